#include "server/mod_davacl/ListStore.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>
#include <utility>

namespace rolvane::davacl {
namespace {

constexpr size_t kLargestFile = 8u << 20;

bool readWhole(int file, std::string& text) {
    char part[16384];
    for (;;) {
        const ssize_t count = ::read(file, part, sizeof part);
        if (count == 0) return true;
        if (count < 0 && errno == EINTR) continue;
        if (count < 0 || text.size() > kLargestFile) return false;
        text.append(part, static_cast<size_t>(count));
    }
}

bool writeWhole(int file, const std::string& text) {
    for (size_t done = 0; done < text.size();) {
        const ssize_t count = ::write(file, text.data() + done, text.size() - done);
        if (count < 0 && errno != EINTR) return false;
        if (count > 0) done += static_cast<size_t>(count);
    }
    return true;
}

bool syncDirectory(const std::string& path) {
    const int directory = open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (directory < 0) return false;
    const bool synced = fsync(directory) == 0;
    close(directory);
    return synced;
}

} // namespace

std::string ListStore::pathFor(const std::string& owner, const char* suffix) const {
    // A dot in front would hide the file, and "." and ".." are no names.
    std::string name = percentEncoded(owner, false);
    if (name.starts_with('.')) name = "%2E" + name.substr(1);
    return _directory + "/" + name + suffix;
}

std::optional<OwnersLists> ListStore::read(const std::string& owner) const {
    const int file = open(pathFor(owner).c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
    if (file < 0) {
        if (errno == ENOENT) return OwnersLists();
        return std::nullopt;
    }
    std::string text;
    const bool complete = readWhole(file, text);
    close(file);
    if (!complete) return std::nullopt;
    return OwnersLists::parse(text);
}

bool ListStore::write(const std::string& owner, const OwnersLists& lists) const {
    const std::string target = pathFor(owner);
    if (lists.empty()) return (unlink(target.c_str()) == 0 || errno == ENOENT) && syncDirectory(_directory);
    std::string fresh = target + ".XXXXXX";
    const int file = mkostemp(fresh.data(), O_CLOEXEC); // mode 0600
    if (file < 0) return false;
    const bool written = writeWhole(file, lists.text()) && fsync(file) == 0;
    int why = errno;
    if (close(file) == 0 && written && rename(fresh.c_str(), target.c_str()) == 0) return syncDirectory(_directory);
    if (written) why = errno;
    unlink(fresh.c_str());
    errno = why;
    return false;
}

// Whoever waits for the lists stands in the gate meanwhile and lets nobody pass: those who share them would otherwise
// follow one another for ever, and the owner would never get a turn.
ListStore::Guard ListStore::guard(const std::string& owner, Hold hold) const {
    const Guard gate = locked(pathFor(owner, ".gate"), LOCK_EX);
    return gate ? locked(pathFor(owner, ".lock"), hold == Hold::shared ? LOCK_SH : LOCK_EX) : Guard();
}

ListStore::Guard ListStore::locked(const std::string& path, int how) {
    Guard held(open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600));
    while (held && flock(held._file, how) != 0)
        if (errno != EINTR) return Guard();
    return held;
}

ListStore::Guard::~Guard() {
    if (_file >= 0) close(_file);
}

ListStore::Guard::Guard(Guard&& other) noexcept : _file(std::exchange(other._file, -1)) {}

ListStore::Guard& ListStore::Guard::operator=(Guard&& other) noexcept {
    if (this != &other) {
        if (_file >= 0) close(_file);
        _file = std::exchange(other._file, -1);
    }
    return *this;
}

} // namespace rolvane::davacl
