#include "server/PasswordFile.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"

#include <algorithm>
#include <array>
#include <crypt.h>
#include <map>
#include <memory>
#include <openssl/crypto.h>
#include <openssl/evp.h>
#include <openssl/rand.h>
#include <unistd.h>

namespace rolvane {

namespace {

// The bcrypt form of the password ("$2y$cost$salt and digest").
std::string bcryptPassword(const std::string& password, int cost) {
    std::array<char, 16> random{};
    std::array<char, CRYPT_GENSALT_OUTPUT_SIZE> setting{};
    const auto work = std::make_unique<crypt_data>();
    if (RAND_bytes(reinterpret_cast<unsigned char*>(random.data()), random.size()) != 1 ||
        !crypt_gensalt_rn("$2y$", static_cast<unsigned long>(cost), random.data(), random.size(), setting.data(),
                          setting.size()))
        throw CXException("CXPrivateStoreException", "No random numbers are to be had for a password's salt.");
    const char* hash = crypt_r(password.c_str(), setting.data(), work.get());
    OPENSSL_cleanse(work->internal, sizeof work->internal);
    if (!hash || !std::string_view(hash).starts_with("$2y$"))
        throw CXException("CXPrivateStoreException", "The password cannot be hashed with bcrypt on this system.");
    return hash;
}

std::string digestEntry(const std::string& user, const std::string& realm, const std::string& password) {
    const std::string text = user + ":" + realm + ":" + password;
    std::array<unsigned char, EVP_MAX_MD_SIZE> digest{};
    unsigned int length = 0;
    if (EVP_Digest(text.data(), text.size(), digest.data(), &length, EVP_md5(), nullptr) != 1)
        throw CXException("CXPrivateStoreException", "OpenSSL gives no MD5, which Digest authentication needs.");
    std::string hex;
    for (unsigned int i = 0; i < length; ++i) {
        hex += "0123456789abcdef"[digest[i] >> 4];
        hex += "0123456789abcdef"[digest[i] & 15];
    }
    return realm + ":" + hex;
}

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

PasswordFile::PasswordFile(std::string passwordsPath, std::string digestsPath, std::string realm, Kept kept)
    : _passwords(std::move(passwordsPath)), _digests(std::move(digestsPath)), _realm(std::move(realm)), _kept(kept) {}

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

std::vector<std::string> PasswordFile::usersWithoutDigest() const {
    const auto digests = readEntries(_digests);
    std::vector<std::string> names = users();
    std::erase_if(names, [&](const std::string& user) { return digests.contains(user); });
    return names;
}

void PasswordFile::set(const std::string& user, const std::string& password) {
    auto passwords = readEntries(_passwords);
    passwords[user] = bcryptPassword(password, _kept.cost);
    if (_kept.digests) {
        auto digests = readEntries(_digests);
        digests[user] = digestEntry(user, _realm, password);
        writeEntries(_digests, digests, _kept.mode);
    }
    writeEntries(_passwords, passwords, _kept.mode);
}

bool PasswordFile::remove(const std::string& user) {
    auto passwords = readEntries(_passwords);
    const bool known = passwords.erase(user) > 0;
    if (access(_digests.c_str(), F_OK) == 0) {
        auto digests = readEntries(_digests);
        digests.erase(user);
        writeEntries(_digests, digests, _kept.mode);
    }
    writeEntries(_passwords, passwords, _kept.mode);
    return known;
}

void PasswordFile::dropDigests() const {
    unlink(_digests.c_str());
}

} // namespace rolvane
