#pragma once

#include <string>
#include <string_view>
#include <sys/types.h>
#include <vector>

namespace rolvane {

// The salted, a thousand times stretched MD5 form that httpd reads ("$apr1$salt$digest"). Checking one costs a tenth of
// a millisecond, which a store that authenticates every request can bear.
std::string aprMD5Password(std::string_view password, std::string_view salt);

// The accounts of a store, kept twice so that either way of authentication finds them:
//   passwords = *( user ":" "$apr1$" salt "$" digest LF )         for Basic
//   digests   = *( user ":" realm ":" hex(MD5(user:realm:password)) LF )   for Digest
// Both are written whole, durably, with the mode given. Lines that are not of this form are kept out.
class PasswordFile {
public:
    PasswordFile(std::string passwordsPath, std::string digestsPath, std::string realm, mode_t mode = 0600);

    static bool isValidUser(std::string_view user);
    std::vector<std::string> users() const; // ascending; empty when there is no file
    bool contains(std::string_view user) const;
    void set(const std::string& user, const std::string& password); // both arguments must be valid
    bool remove(const std::string& user);

private:
    std::string _passwords, _digests, _realm;
    mode_t _mode;
};

} // namespace rolvane
