#include "server/mod_davacl/PasswordChange.h"

#include "server/mod_davacl/Configuration.h"
#include "server/mod_davacl/OwnPasswords.h"

#include <algorithm>
#include <apr_general.h>
#include <apr_md5.h>
#include <cerrno>
#include <cstring>
#include <optional>

namespace rolvane::davacl {
namespace {

constexpr const char* kType = "application/x-rolvane-password";
constexpr const char* kGiven = "davacl-given-hash";
constexpr const char* kInForce = "davacl-hash-in-force";
constexpr int kCost = 10; // as the private store's own

int refuse(request_rec* r, int status, const char* words) {
    ap_custom_response(r, status, apr_pstrcat(r->pool, words, "\n", nullptr));
    return status;
}

// At most one byte more than a password may have. Nothing when it does not come.
std::optional<std::string> bodyOf(request_rec* r) {
    if (ap_setup_client_block(r, REQUEST_CHUNKED_DECHUNK) != OK || !ap_should_client_block(r)) return std::nullopt;
    std::string body;
    char part[OwnPasswords::kLongest + 1];
    while (body.size() <= OwnPasswords::kLongest) {
        const long count = ap_get_client_block(r, part, sizeof part);
        if (count < 0) return std::nullopt;
        if (count == 0) break;
        body.append(part, static_cast<size_t>(count));
    }
    explicit_bzero(part, sizeof part);
    return body;
}

bool isUsable(const std::string& password) {
    return password.size() >= OwnPasswords::kShortest && password.size() <= OwnPasswords::kLongest &&
           std::none_of(password.begin(), password.end(), [](unsigned char c) { return c < 0x20 || c == 0x7f; });
}

std::string hashOf(const std::string& password) {
    unsigned char salt[16];
    char hash[128] = "";
    if (apr_generate_random_bytes(salt, sizeof salt) != APR_SUCCESS ||
        apr_bcrypt_encode(password.c_str(), kCost, salt, sizeof salt, hash, sizeof hash) != APR_SUCCESS)
        return {};
    return hash;
}

} // namespace

void noteHashes(request_rec* r, const char* given, const char* inForce) {
    apr_table_set(r->notes, kGiven, given);
    apr_table_set(r->notes, kInForce, inForce);
}

int changePassword(request_rec* r) {
    const char* directory = ownPasswordsOf(r);
    const char* given = apr_table_get(r->notes, kGiven);
    const char* inForce = apr_table_get(r->notes, kInForce);
    if (!directory || !given || !inForce) return HTTP_METHOD_NOT_ALLOWED;
    const char* type = apr_table_get(r->headers_in, "Content-Type");
    if (!type || std::strcmp(type, kType) != 0) return HTTP_UNSUPPORTED_MEDIA_TYPE;
    auto password = bodyOf(r);
    if (!password) return HTTP_BAD_REQUEST;
    if (!isUsable(*password))
        return refuse(r, HTTP_UNPROCESSABLE_ENTITY, "A password has 8 to 72 bytes and no control characters.");
    const std::string hash = hashOf(*password);
    explicit_bzero(password->data(), password->size());
    if (hash.empty()) return HTTP_INTERNAL_SERVER_ERROR;
    switch (OwnPasswords(directory).choose(r->user, given, inForce, hash)) {
    case OwnPasswords::Written::done: break;
    case OwnPasswords::Written::otherMeanwhile:
        return refuse(r, HTTP_CONFLICT, "The password was changed by another request at this moment.");
    case OwnPasswords::Written::failed:
        ap_log_rerror(APLOG_MARK, APLOG_ERR, errno, r,
                      "davacl: the password of %s could not be changed: look whether %s can be written", r->user,
                      directory);
        return HTTP_INTERNAL_SERVER_ERROR;
    }
    ap_log_rerror(APLOG_MARK, APLOG_INFO, 0, r, "davacl: %s has changed the own password", r->user);
    r->status = HTTP_NO_CONTENT;
    ap_set_content_length(r, 0);
    return OK;
}

} // namespace rolvane::davacl
