#include "server/mod_davacl/Passwords.h"

#include "server/mod_davacl/Configuration.h"
#include "server/mod_davacl/LastUse.h"
#include "server/mod_davacl/OwnPasswords.h"
#include "server/mod_davacl/PasswordChange.h"
#include "server/mod_davacl/PasswordLines.h"
#include "server/mod_davacl/SignInBrake.h"
#include "server/mod_davacl/SignInMemory.h"

#include <apr_md5.h>
#include <array>
#include <chrono>
#include <functional>
#include <mutex>
#include <string>

namespace rolvane::davacl {
namespace {

SignInMemory* memory = nullptr; // of the configuration in force
SignInBrake* brake = nullptr;   // likewise

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

// Where the request comes from, as its address's bytes.
std::string_view addressOf(const request_rec* r) {
    const apr_sockaddr_t* address = r->useragent_addr;
    if (!address || !address->ipaddr_ptr) return {};
    return {static_cast<const char*>(address->ipaddr_ptr), static_cast<size_t>(address->ipaddr_len)};
}

int64_t millisecondsNow() {
    return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now().time_since_epoch())
        .count();
}

// A password that nobody has shown before. Who has been wrong too often is not looked at for a while.
bool isRightAndInTime(request_rec* r, const char* user, const std::function<bool()>& isRight) {
    if (!brake || !slowsGuesses(r)) return isRight();
    const uint64_t place = SignInBrake::place(user, addressOf(r));
    if (!brake->looks(place, millisecondsNow())) return false;
    if (isRight()) {
        brake->right(place);
        return true;
    }
    if (const int64_t pause = brake->wrong(place, millisecondsNow()))
        ap_log_rerror(APLOG_MARK, APLOG_WARNING, 0, r,
                      "davacl: another wrong password for %s from %s: no password from there counts for %d seconds",
                      user, r->useragent_ip, static_cast<int>(pause / 1000));
    return false;
}

authn_status granted(request_rec* r, const char* user) {
    static auto* uses = new LastUse; // lives as long as the process, as `lines` does
    if (const char* directory = lastUseDirectoryOf(r)) uses->note(directory, user, std::chrono::steady_clock::now());
    return AUTH_GRANTED;
}

apr_status_t release(void* mapped) {
    static_cast<SignInBrake*>(mapped)->unmap();
    if (brake == mapped) brake = nullptr;
    return APR_SUCCESS;
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
    const std::string given = known ? found.hash : hashInstead(*found.others, numberOf(user));
    const char* const own = ownPasswordsOf(r);
    const std::string hash = own ? OwnPasswords(own).inForce(user, given) : given;
    if (own && known) noteHashes(r, given.c_str(), hash.c_str());
    const auto isRight = [&] {
        ap_log_rerror(APLOG_MARK, APLOG_DEBUG, 0, r, "davacl: the password of %s is checked in full", user);
        const bool right = apr_password_validate(password, hash.c_str()) == APR_SUCCESS;
        return right && known;
    };
    const auto refused = known ? AUTH_DENIED : AUTH_USER_NOT_FOUND;
    if (!memory) return isRightAndInTime(r, user, isRight) ? granted(r, user) : refused;
    // An unknown name goes the same way, at the same cost, to another end.
    const SignInMemory::Mark mark = memory->markOf(user, hash, password);
    if (memory->knows(mark) && known) return granted(r, user);
    const std::lock_guard turn(turnOf(mark));
    if (memory->knows(mark) && known) return granted(r, user);
    if (!isRightAndInTime(r, user, isRight)) return refused;
    memory->remember(mark);
    return granted(r, user);
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

std::optional<std::string> hashInForce(const request_rec* r, const std::string& user) {
    const char* path = userFileOf(r);
    if (!path) return std::nullopt;
    const auto found = lines().find(path, user);
    if (found.answer != PasswordLines::Answer::known) return std::nullopt;
    const char* const own = ownPasswordsOf(r);
    return own ? OwnPasswords(own).inForce(user, found.hash) : found.hash;
}

const char* preparePasswords(apr_pool_t* pool) {
    memory = SignInMemory::map();
    brake = SignInBrake::map();
    if (brake) apr_pool_cleanup_register(pool, brake, release, apr_pool_cleanup_null);
    if (!memory || !brake) return "there is no memory, or no random number, to remember sign-ins with";
    apr_pool_cleanup_register(pool, memory, forget, apr_pool_cleanup_null);
    return nullptr;
}

} // namespace rolvane::davacl
