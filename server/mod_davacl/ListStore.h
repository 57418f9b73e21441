#pragma once

#include "server/mod_davacl/AccessLists.h"

#include <optional>
#include <string>

namespace rolvane::davacl {

// The files of the lists: <directory>/<owner, encoded>.acl, one an owner, and a .lock and a .gate beside it. No
// exception of its own; any number of processes and threads.
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
        friend class ListStore;
        int _file = -1;
    };
    enum class Hold { shared, exclusive };
    // Waits its turn, behind whoever came before; false when it cannot be had. A thread that holds the lists of an
    // owner must not ask for them again, and asks for those of several owners in the order of their names.
    Guard guard(const std::string& owner, Hold hold) const;

    std::string pathFor(const std::string& owner, const char* suffix = ".acl") const;

private:
    static Guard locked(const std::string& path, int how); // flock's LOCK_SH or LOCK_EX

    std::string _directory;
};

} // namespace rolvane::davacl
