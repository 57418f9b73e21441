#include "server/mod_davacl/Passwords.h"

#include "server/mod_davacl/Configuration.h"
#include "server/mod_davacl/PasswordLines.h"
#include "server/mod_davacl/SignInMemory.h"

#include <apr_md5.h>
#include <array>
#include <functional>
#include <mutex>
#include <string>

namespace rolvane::davacl {
namespace {

SignInMemory* memory = nullptr; // of the configuration in force

// Live as long as the process: other threads may still ask when it ends.
PasswordLines& lines() {
    static auto* all = new PasswordLines;
    return *all;
}

// Of several first requests of one user one computes, and the others wait for it.
std::mutex& turnOf(const SignInMemory::Mark& mark) {
    static auto* all = new std::array<std::mutex, 64>;
    return (*all)[mark[1] % all->size()];
}

// The same for a name as long as the server's configuration is in force, and known to nobody.
uint64_t numberOf(const char* user) {
    return memory ? memory->markOf(user, {}, {})[0] : std::hash<std::string_view>()(user);
}

apr_status_t forget(void* mapped) {
    static_cast<SignInMemory*>(mapped)->unmap();
    if (memory == mapped) memory = nullptr;
    return APR_SUCCESS;
}

authn_status check(request_rec* r, const char* user, const char* password) {
    const char* path = userFileOf(r);
    if (!path) {
        ap_log_rerror(APLOG_MARK, APLOG_ERR, 0, r, "davacl: \"AuthBasicProvider davacl\" needs a DavAclUserFile");
        return AUTH_GENERAL_ERROR;
    }
    const auto found = lines().find(path, user);
    if (found.answer == PasswordLines::Answer::unreadable) {
        ap_log_rerror(APLOG_MARK, APLOG_ERR, 0, r, "davacl: the password file %s cannot be read", path);
        return AUTH_GENERAL_ERROR;
    }
    const bool known = found.answer == PasswordLines::Answer::known;
    const std::string hash = known ? found.hash : hashInstead(*found.others, numberOf(user));
    const auto isRight = [&] {
        ap_log_rerror(APLOG_MARK, APLOG_DEBUG, 0, r, "davacl: the password of %s is checked in full", user);
        const bool right = apr_password_validate(password, hash.c_str()) == APR_SUCCESS;
        return right && known;
    };
    const auto refused = known ? AUTH_DENIED : AUTH_USER_NOT_FOUND;
    if (!memory) return isRight() ? AUTH_GRANTED : refused;
    // Who is not known goes the same way, at the same cost, to another end.
    const SignInMemory::Mark mark = memory->markOf(user, hash, password);
    if (memory->knows(mark) && known) return AUTH_GRANTED;
    const std::lock_guard turn(turnOf(mark));
    if (memory->knows(mark) && known) return AUTH_GRANTED;
    if (!isRight()) return refused;
    memory->remember(mark);
    return AUTH_GRANTED;
}

authn_status checkPassword(request_rec* r, const char* user, const char* password) noexcept {
    return contained(r, AUTH_GENERAL_ERROR, [&] { return check(r, user, password); });
}

constexpr authn_provider kProvider = {checkPassword, nullptr};

} // namespace

void registerPasswords(apr_pool_t* pool) {
    ap_register_auth_provider(pool, AUTHN_PROVIDER_GROUP, "davacl", AUTHN_PROVIDER_VERSION, &kProvider,
                              AP_AUTH_INTERNAL_PER_CONF);
}

const char* preparePasswords(apr_pool_t* pool) {
    memory = SignInMemory::map();
    if (!memory) return "there is no memory, or no random number, to remember sign-ins with";
    apr_pool_cleanup_register(pool, memory, forget, apr_pool_cleanup_null);
    return nullptr;
}

} // namespace rolvane::davacl
