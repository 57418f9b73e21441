#include "store/account/Invitation.h"

#include "foundation/Base64.h"
#include "foundation/CXException.h"
#include "store/account/Account.h"
#include "store/account/CertificateChain.h"

#include <algorithm>
#include <cctype>
#include <openssl/evp.h>
#include <openssl/rand.h>

namespace rolvane {

namespace {

constexpr std::string_view kScheme = "rolvane:";
constexpr std::string_view kVersion = "1";
constexpr size_t kCheckBytes = 4;
constexpr size_t kLongest = 8192;
constexpr std::string Invitation::*kFields[] = {&Invitation::endpoint,     &Invitation::user,
                                                &Invitation::fingerprint,  &Invitation::password,
                                                &Invitation::passwordPath, &Invitation::inviter};

[[noreturn]] void fail(const std::string& reason) {
    throw CXException(kCXNetworkException, reason);
}

std::string checkOf(std::string_view payload) {
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned int size = 0;
    if (EVP_Digest(payload.data(), payload.size(), digest, &size, EVP_sha256(), nullptr) != 1 || size < kCheckBytes)
        fail("The system's OpenSSL gives no SHA-256.");
    return std::string(reinterpret_cast<const char*>(digest), kCheckBytes);
}

std::string toBase64Url(const std::string& bytes) {
    std::string text;
    appendBase64(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size(), text);
    std::erase_if(text, [](char c) { return c == '=' || c == '\n'; });
    std::replace(text.begin(), text.end(), '+', '-');
    std::replace(text.begin(), text.end(), '/', '_');
    return text;
}

std::optional<std::string> fromBase64Url(std::string text) {
    if (!std::all_of(text.begin(), text.end(),
                     [](unsigned char c) { return std::isalnum(c) != 0 || c == '-' || c == '_'; }))
        return std::nullopt;
    std::replace(text.begin(), text.end(), '-', '+');
    std::replace(text.begin(), text.end(), '_', '/');
    while (text.size() % 4 != 0) text += '=';
    const auto bytes = fromBase64(text);
    if (!bytes) return std::nullopt;
    return std::string(bytes->begin(), bytes->end());
}

// A line as it was copied from somewhere.
std::string cleaned(const std::string& line) {
    std::string text;
    for (const char c : line)
        if (std::isspace(static_cast<unsigned char>(c)) == 0 && std::string_view("\"'<>").find(c) == std::string::npos)
            text += c;
    return text;
}

} // namespace

std::string Invitation::line() const {
    std::string payload;
    for (const auto field : kFields) {
        if ((this->*field).find_first_of(std::string("\n\r\0", 3)) != std::string::npos)
            fail("An invitation cannot hold a line break.");
        payload += this->*field + "\n";
    }
    return std::string(kScheme) + std::string(kVersion) + ":" + toBase64Url(payload + checkOf(payload));
}

Invitation Invitation::fromLine(const std::string& line) {
    const std::string text = line.size() <= kLongest ? cleaned(line) : std::string();
    if (!text.starts_with(kScheme))
        fail("That is no invitation: one begins with \"rolvane:1:\". Copy the whole line that you were sent.");
    const size_t colon = text.find(':', kScheme.size());
    const std::string version = text.substr(kScheme.size(), colon - kScheme.size());
    if (colon == std::string::npos || version.empty() ||
        !std::all_of(version.begin(), version.end(), [](unsigned char c) { return std::isdigit(c) != 0; }))
        fail("The invitation is cut off, or something else stands in it. Copy the whole line that you were sent.");
    if (version != kVersion)
        fail("The invitation has the form " + version + ", and this program reads form 1. Install a newer rolvane.");
    const auto bytes = fromBase64Url(text.substr(colon + 1));
    const size_t size = bytes && bytes->size() > kCheckBytes ? bytes->size() - kCheckBytes : 0;
    if (size == 0 || toBase64Url(*bytes) != text.substr(colon + 1) ||
        checkOf(std::string_view(*bytes).substr(0, size)) != bytes->substr(size))
        fail("The invitation is cut off or altered. Copy the whole line that you were sent, without anything else.");
    Invitation read;
    size_t from = 0;
    for (const auto field : kFields) {
        const size_t end = bytes->find('\n', from);
        if (end == std::string::npos || end >= size) fail("The invitation lacks something. Ask for another one.");
        read.*field = bytes->substr(from, end - from);
        from = end + 1;
    }
    // Whoever made the line may be anybody.
    CXDAVAccount account;
    account.user = UserName(read.user);
    account.endpoint = read.endpoint;
    const auto problem = account.problem();
    if (problem) fail("The invitation cannot be used. " + *problem);
    if (!read.fingerprint.empty() && !normalFingerprint(read.fingerprint))
        fail("The invitation cannot be used: its fingerprint is none. Ask for another one.");
    if (!read.passwordPath.empty() && read.passwordPath.front() != '/')
        fail("The invitation cannot be used: its place to change the password is no path. Ask for another one.");
    return read;
}

std::string makePassword() {
    // Five bits each.
    constexpr std::string_view kLetters = "abcdefghijkmnpqrstuvwxyz23456789";
    static_assert(kLetters.size() == 32);
    unsigned char random[26];
    if (RAND_bytes(random, sizeof random) != 1) fail("No random numbers are to be had for a password.");
    std::string text;
    for (size_t i = 0; i < sizeof random; ++i) {
        if (i > 0 && i % 5 == 0) text += '-';
        text += kLetters[random[i] & 31];
    }
    return text;
}

} // namespace rolvane
