#include "foundation/TemporaryFiles.h"

#include <algorithm>
#include <ctime>
#include <fcntl.h>
#include <filesystem>
#include <string_view>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

namespace rolvane {

namespace {

constexpr size_t kRandomLetters = 6;
constexpr time_t kOld = 60; // seconds; between a file's making and its lock lies a moment

bool areRandomLetters(std::string_view text) {
    return text.size() == kRandomLetters && std::all_of(text.begin(), text.end(), [](char c) {
               return (c >= '0' && c <= '9') || (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z');
           });
}

// The name of a lock's note or of a run's: sixteen hexadecimal digits, or a UUID.
bool namesALock(std::string_view name) {
    constexpr size_t kDigest = 16, kUUID = 36;
    return (name.size() == kDigest || name.size() == kUUID) &&
           name.find_first_not_of("0123456789ABCDEFabcdef-") == std::string_view::npos;
}

bool isTemporaryName(const std::string& name) {
    if (name.size() <= kRandomLetters || !areRandomLetters(std::string_view(name).substr(name.size() - kRandomLetters)))
        return false;
    const std::string_view stem = std::string_view(name).substr(0, name.size() - kRandomLetters);
    return stem.ends_with(kTemporaryMark) || (stem.ends_with('.') && namesALock(stem.substr(0, stem.size() - 1)));
}

// Whether it went. Its writer holds the lock until the file has its name or is gone.
bool removeUnlessWritten(const std::string& path) {
    const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK);
    if (fd < 0) return false;
    struct stat opened {
    }, named{};
    const bool gone = ::fstat(fd, &opened) == 0 && S_ISREG(opened.st_mode) &&
                      opened.st_mtime < ::time(nullptr) - kOld && ::flock(fd, LOCK_EX | LOCK_NB) == 0 &&
                      ::lstat(path.c_str(), &named) == 0 && named.st_ino == opened.st_ino &&
                      named.st_dev == opened.st_dev && ::unlink(path.c_str()) == 0;
    ::close(fd);
    return gone;
}

} // namespace

size_t removeLeftTemporaryFiles(const std::string& directory) {
    size_t removed = 0;
    std::error_code error;
    for (std::filesystem::directory_iterator each(directory, error), end; !error && each != end; each.increment(error))
        if (isTemporaryName(each->path().filename().string())) removed += removeUnlessWritten(each->path().string());
    return removed;
}

} // namespace rolvane
