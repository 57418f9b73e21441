#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace rolvane::davacl {

// Passwords that users have chosen themselves, in the place of those that the administrator gave them. The files:
//   <directory>/<user, encoded>.password = hex( SHA-256( given ) ) LF chosen LF
// where `given` is the hash in the administrator's file and `chosen` the one that counts instead. So a choice ends by
// itself when the administrator gives the user another password, or takes the account away.
//
// httpd's user writes here and never in the administrator's file. Any number of processes and threads; nothing throws.
class OwnPasswords {
public:
    explicit OwnPasswords(std::string directory) : _directory(std::move(directory)) {}

    // The hash that counts: the chosen one, or `given`.
    std::string inForce(std::string_view user, const std::string& given) const;

    enum class Written { done, otherMeanwhile, failed };
    // Whole and durable when done. `otherMeanwhile`: the hash in force is not `former`; nothing was written. After a
    // failure the former choice stands, and errno says why.
    Written choose(std::string_view user, const std::string& given, const std::string& former,
                   const std::string& chosen) const;

    static constexpr size_t kShortest = 8, kLongest = 72; // bytes of a password; bcrypt reads no more

private:
    std::string pathFor(std::string_view user) const;

    std::string _directory;
};

} // namespace rolvane::davacl
