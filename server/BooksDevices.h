#pragma once

#include <chrono>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

struct BooksDevice {
    std::string name;
    std::optional<std::chrono::system_clock::time_point> lastUse; // exact to a minute; none: never used
};

// The devices that may sign in to a user's address books, each with a password of its own, below the state directory of
// a BooksServer:
//   conf/passwords   as PasswordFile writes it, mode 0600
//   used/<name>      a file whose date is the device's last sign-in
// A running server takes every change in at the next request. A password is 160 random bits, which nobody guesses: its
// bcrypt hash has the least cost, since a slow one would protect nothing more.
// Operations throw kCXPrivateStoreException.
class BooksDevices {
public:
    explicit BooksDevices(const std::string& booksDirectory); // "" = stateDirectory()/books

    // A new password for the device, which is told once and kept nowhere. A device of that name loses its old one.
    // Names: letters, digits and . _ - @ +, at most 64, the first a letter, digit or '_'.
    std::string add(const std::string& name) const;
    bool remove(const std::string& name) const; // false when there is none of that name
    bool contains(const std::string& name) const;
    std::vector<BooksDevice> all() const; // ascending by name

    static std::string randomPassword(); // "abcd-efgh-...": 32 characters of 5 bits, in groups of four

private:
    void makeDirectories() const;
    std::string _directory;
};

} // namespace rolvane
