#include "server/PasswordFile.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"

#include <algorithm>
#include <array>
#include <map>
#include <openssl/evp.h>
#include <openssl/rand.h>
#include <unistd.h>

namespace rolvane {

namespace {

using Digest = std::array<unsigned char, 16>;
constexpr std::string_view kSaltAlphabet = "./0123456789ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz";

class MD5 {
public:
    MD5() { EVP_DigestInit_ex(_context, EVP_md5(), nullptr); }
    ~MD5() { EVP_MD_CTX_free(_context); }
    MD5(const MD5&) = delete;
    MD5& operator=(const MD5&) = delete;
    void add(const void* data, size_t size) { EVP_DigestUpdate(_context, data, size); }
    void add(std::string_view text) { add(text.data(), text.size()); }
    void add(const Digest& digest) { add(digest.data(), digest.size()); }
    Digest finish() {
        Digest out;
        EVP_DigestFinal_ex(_context, out.data(), nullptr);
        return out;
    }

private:
    EVP_MD_CTX* _context = EVP_MD_CTX_new();
};

Digest firstDigest(std::string_view password, std::string_view salt) {
    MD5 inner;
    inner.add(password);
    inner.add(salt);
    inner.add(password);
    const Digest mixed = inner.finish();

    MD5 outer;
    outer.add(password);
    outer.add("$apr1$");
    outer.add(salt);
    for (size_t left = password.size(); left > 0; left -= std::min<size_t>(left, mixed.size()))
        outer.add(mixed.data(), std::min<size_t>(left, mixed.size()));
    for (size_t bits = password.size(); bits > 0; bits >>= 1)
        outer.add(bits & 1 ? std::string_view("\0", 1) : password.substr(0, 1));
    return outer.finish();
}

Digest stretched(Digest digest, std::string_view password, std::string_view salt) {
    for (int round = 0; round < 1000; ++round) {
        MD5 next;
        round % 2 ? next.add(password) : next.add(digest);
        if (round % 3) next.add(salt);
        if (round % 7) next.add(password);
        round % 2 ? next.add(digest) : next.add(password);
        digest = next.finish();
    }
    return digest;
}

// Six bits a character, lowest first.
void appendBase64(std::string& out, unsigned value, int characters) {
    for (; characters > 0; --characters, value >>= 6) out += kSaltAlphabet[value & 0x3f];
}

std::string randomSalt() {
    std::array<unsigned char, 8> bytes;
    if (RAND_bytes(bytes.data(), bytes.size()) != 1)
        throw CXException("CXPrivateStoreException",
                          "No random numbers are to be had from OpenSSL for a password's salt.");
    std::string salt;
    for (unsigned char byte : bytes) salt += kSaltAlphabet[byte % kSaltAlphabet.size()];
    return salt;
}

std::string digestEntry(const std::string& user, const std::string& realm, const std::string& password) {
    MD5 md5;
    md5.add(user + ":" + realm + ":" + password);
    std::string hex;
    for (unsigned char byte : md5.finish()) {
        hex += "0123456789abcdef"[byte >> 4];
        hex += "0123456789abcdef"[byte & 15];
    }
    return realm + ":" + hex;
}

// user -> what follows the first colon
std::map<std::string, std::string, std::less<>> readEntries(const std::string& path) {
    std::map<std::string, std::string, std::less<>> entries;
    if (access(path.c_str(), F_OK) != 0) return entries;
    const std::string text = readFile(path);
    for (size_t from = 0; from < text.size();) {
        const size_t end = std::min(text.find('\n', from), text.size());
        const std::string line = text.substr(from, end - from);
        const size_t colon = line.find(':');
        if (colon != std::string::npos && PasswordFile::isValidUser(line.substr(0, colon)))
            entries[line.substr(0, colon)] = line.substr(colon + 1);
        from = end + 1;
    }
    return entries;
}

void writeEntries(const std::string& path, const std::map<std::string, std::string, std::less<>>& entries,
                  mode_t mode) {
    std::string text;
    for (const auto& [user, rest] : entries) text += user + ":" + rest + "\n";
    writeFileDurably(path, text, mode);
}

} // namespace

std::string aprMD5Password(std::string_view password, std::string_view salt) {
    const Digest d = stretched(firstDigest(password, salt), password, salt);
    std::string out = "$apr1$" + std::string(salt) + "$";
    constexpr int kOrder[5][3] = {{0, 6, 12}, {1, 7, 13}, {2, 8, 14}, {3, 9, 15}, {4, 10, 5}};
    for (const auto& [high, middle, low] : kOrder) appendBase64(out, d[high] << 16 | d[middle] << 8 | d[low], 4);
    appendBase64(out, d[11], 2);
    return out;
}

PasswordFile::PasswordFile(std::string passwordsPath, std::string digestsPath, std::string realm, mode_t mode)
    : _passwords(std::move(passwordsPath)), _digests(std::move(digestsPath)), _realm(std::move(realm)), _mode(mode) {}

bool PasswordFile::isValidUser(std::string_view user) {
    const auto isAlphanumeric = [](char c) {
        return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9');
    };
    if (user.empty() || user.size() > 64 || !(isAlphanumeric(user[0]) || user[0] == '_')) return false;
    return std::all_of(user.begin(), user.end(), [&](char c) {
        return isAlphanumeric(c) || std::string_view("._-@+").find(c) != std::string_view::npos;
    });
}

std::vector<std::string> PasswordFile::users() const {
    std::vector<std::string> names;
    for (const auto& [user, rest] : readEntries(_passwords)) names.push_back(user);
    return names;
}

bool PasswordFile::contains(std::string_view user) const {
    return readEntries(_passwords).contains(user);
}

void PasswordFile::set(const std::string& user, const std::string& password) {
    auto passwords = readEntries(_passwords);
    auto digests = readEntries(_digests);
    passwords[user] = aprMD5Password(password, randomSalt());
    digests[user] = digestEntry(user, _realm, password);
    writeEntries(_digests, digests, _mode);
    writeEntries(_passwords, passwords, _mode);
}

bool PasswordFile::remove(const std::string& user) {
    auto passwords = readEntries(_passwords);
    auto digests = readEntries(_digests);
    const bool known = passwords.erase(user) > 0;
    digests.erase(user);
    writeEntries(_digests, digests, _mode);
    writeEntries(_passwords, passwords, _mode);
    return known;
}

} // namespace rolvane
