#pragma once

#include "store/files/CXFileManager.h"

#include <optional>
#include <string>
#include <string_view>
#include <sys/types.h>

namespace rolvane {

// Files of this machine, some of them in folders that other people may write to as well. So nothing is done through
// what somebody else may have put there: the last component of a path is never followed when it is a symbolic link, and
// below `root` no component is; only regular files are read and written (opening a pipe or a device never waits), and a
// file that has a second name is not written, because it may be somebody's own.
//
// Operations give 0 or an error number of the operating system: ELOOP for a link in the way, EINVAL for a path that is
// not absolute, leaves the root, or has a component "." or "..". Nothing throws. Any thread; operations are not atomic.
class LocalFiles {
public:
    // Absolute, without trailing slash; on the way to it links are followed. Empty: every path is allowed, and links in
    // the folders on the way are followed.
    explicit LocalFiles(std::string root = {}) : _root(std::move(root)) {}

    int read(const std::string& path, std::string& contents, size_t maxBytes = 64u << 20) const; // EFBIG beyond it
    // Replaces the contents; a new file has the mode 0666 less the umask, or exactly `mode` when one is given (an
    // existing one gets it, too, where that is allowed). The folder must exist.
    int write(const std::string& path, std::string_view contents, std::optional<mode_t> mode = {}) const;
    // With all missing parents, each of exactly the mode. Directories that exist keep theirs.
    int makeDirectories(const std::string& path, mode_t mode) const;
    bool isDirectory(const std::string& path) const;
    int rename(const std::string& from, const std::string& to) const;
    int removeFile(const std::string& path) const;
    int removeTree(const std::string& path) const; // a file, or a directory with its contents; absence: ENOENT
    // What lies in the directory: regular files and directories, no links, pipes or devices. Complete or an error.
    int list(const std::string& path, FileListing& out) const;

private:
    const std::string _root;
};

} // namespace rolvane
