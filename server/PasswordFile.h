#pragma once

#include <string>
#include <string_view>
#include <sys/types.h>
#include <vector>

namespace rolvane {

// The accounts of a store:
//   passwords = *( user ":" bcrypt LF )                                    for Basic
//   digests   = *( user ":" realm ":" hex(MD5(user:realm:password)) LF )   for Digest
// The second is as good as the passwords themselves, and kept only where Digest is asked for. Lines of passwords in the
// other forms that httpd reads, which earlier versions and htpasswd wrote, stay as they are. Both files are written
// whole, durably. Lines that name no valid user are kept out.
class PasswordFile {
public:
    struct Kept {
        bool digests = false;
        int cost = 10; // of bcrypt: 2 to the power of it rounds, 4 to 31; 10 takes about a twentieth of a second
        mode_t mode = 0600;
    };
    static constexpr size_t kLongestPassword = 72; // bytes: bcrypt reads no more

    PasswordFile(std::string passwordsPath, std::string digestsPath, std::string realm, Kept kept);

    static bool isValidUser(std::string_view user);
    std::vector<std::string> users() const; // ascending; empty when there is no file
    std::vector<std::string> usersWithoutDigest() const;
    bool contains(std::string_view user) const;
    void set(const std::string& user, const std::string& password); // both arguments must be valid
    bool remove(const std::string& user);
    void dropDigests() const; // the whole file, when there is one

private:
    std::string _passwords, _digests, _realm;
    Kept _kept;
};

} // namespace rolvane
