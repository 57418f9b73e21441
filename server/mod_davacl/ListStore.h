#pragma once

#include "server/mod_davacl/AccessLists.h"

#include <optional>
#include <string>

namespace rolvane::davacl {

// The files of the lists: <directory>/<owner, encoded>.acl, one an owner, and a .lock beside it. No exception of its
// own; any number of processes and threads.
class ListStore {
public:
    explicit ListStore(std::string directory) : _directory(std::move(directory)) {}

    // No file is no list. Nothing when the file cannot be read or is damaged.
    std::optional<OwnersLists> read(const std::string& owner) const;
    // Whole and durable when true: a crash leaves either version. Else the old lists stand, and errno says why.
    bool write(const std::string& owner, const OwnersLists& lists) const;

    // Keeps the lists of an owner as they are (shared), or everybody who relies on them away (exclusive).
    class Guard {
    public:
        Guard() = default;
        explicit Guard(int file) : _file(file) {}
        ~Guard();
        Guard(Guard&& other) noexcept;
        Guard& operator=(Guard&& other) noexcept;
        explicit operator bool() const { return _file >= 0; }

    private:
        int _file = -1;
    };
    enum class Hold { shared, exclusive };
    Guard guard(const std::string& owner, Hold hold) const; // waits; false when it cannot be had

    std::string pathFor(const std::string& owner, const char* suffix = ".acl") const;

private:
    std::string _directory;
};

} // namespace rolvane::davacl
