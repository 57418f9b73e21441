#include "store/files/LocalFiles.h"

#include <algorithm>
#include <cerrno>
#include <dirent.h>
#include <fcntl.h>
#include <memory>
#include <sys/stat.h>
#include <unistd.h>
#include <utility>
#include <vector>

namespace rolvane {
namespace {

constexpr int kFolder = O_PATH | O_DIRECTORY | O_CLOEXEC;
constexpr int kDeepestTree = 256;

// An open descriptor, or the error number of the attempt.
class Descriptor {
public:
    explicit Descriptor(int result) : _fd(result), _error(result < 0 ? errno : 0) {}
    static Descriptor failed(int error) {
        errno = error;
        return Descriptor(-1);
    }
    ~Descriptor() {
        if (_fd >= 0) ::close(_fd);
    }
    Descriptor(Descriptor&& other) noexcept : _fd(std::exchange(other._fd, -1)), _error(other._error) {}
    Descriptor& operator=(Descriptor&& other) noexcept {
        std::swap(_fd, other._fd);
        std::swap(_error, other._error);
        return *this;
    }
    explicit operator bool() const { return _fd >= 0; }
    int get() const { return _fd; }
    int error() const { return _error; }
    int release() { return std::exchange(_fd, -1); }

private:
    int _fd;
    int _error;
};

struct stat statusOf(const Descriptor& fd) {
    struct stat status {};
    if (::fstat(fd.get(), &status) != 0) status = {};
    return status;
}

bool isLink(const Descriptor& folder, const std::string& name) {
    struct stat status;
    return ::fstatat(folder.get(), name.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0 && S_ISLNK(status.st_mode);
}

// The folder of that name, never through a link.
Descriptor folderIn(const Descriptor& parent, const std::string& name) {
    Descriptor folder(::openat(parent.get(), name.c_str(), kFolder | O_NOFOLLOW));
    if (!folder && folder.error() == ENOTDIR && isLink(parent, name)) return Descriptor::failed(ELOOP);
    return folder;
}

// The components of an absolute path, or nothing when it has one that leads elsewhere.
std::optional<std::vector<std::string>> componentsOf(std::string_view path) {
    if (path.empty() || path.front() != '/' || path.find('\0') != path.npos) return std::nullopt;
    std::vector<std::string> components;
    for (size_t at = 1; at <= path.size();) {
        const size_t slash = std::min(path.find('/', at), path.size());
        const std::string_view component = path.substr(at, slash - at);
        if (component == "." || component == "..") return std::nullopt;
        if (!component.empty()) components.emplace_back(component);
        at = slash + 1;
    }
    return components;
}

std::string joined(const std::vector<std::string>& components, size_t count) {
    std::string path;
    for (size_t i = 0; i < count; ++i) path += "/" + components[i];
    return path.empty() ? "/" : path;
}

// A path taken apart: a folder that is there already, and what lies below it.
struct Place {
    std::string trusted;            // opened as it is, links followed
    std::vector<std::string> below; // never empty; no link is followed in it
};

std::optional<Place> placeOf(const std::string& path, const std::string& root) {
    const auto components = componentsOf(path);
    if (!components || components->empty()) return std::nullopt;
    if (root.empty()) return Place{joined(*components, components->size() - 1), {components->back()}};
    const auto rooted = componentsOf(root);
    if (!rooted || components->size() <= rooted->size() ||
        !std::equal(rooted->begin(), rooted->end(), components->begin()))
        return std::nullopt;
    return Place{joined(*rooted, rooted->size()),
                 {components->begin() + static_cast<ptrdiff_t>(rooted->size()), components->end()}};
}

// The folder that holds the path's last component.
Descriptor parentOf(const Place& place) {
    Descriptor folder(::open(place.trusted.c_str(), kFolder));
    for (size_t i = 0; folder && i + 1 < place.below.size(); ++i) folder = folderIn(folder, place.below[i]);
    return folder;
}

// A folder that was made just now gets exactly the mode, whatever the umask.
int makeFolder(const Descriptor& parent, const std::string& name, mode_t mode) {
    if (::mkdirat(parent.get(), name.c_str(), mode | S_IRWXU) != 0) return errno == EEXIST ? 0 : errno;
    const Descriptor made(::openat(parent.get(), name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!made) return made.error();
    return ::fchmod(made.get(), mode) == 0 ? 0 : errno;
}

int writeAll(const Descriptor& fd, std::string_view rest) {
    while (!rest.empty()) {
        const ssize_t n = ::write(fd.get(), rest.data(), rest.size());
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) return errno;
        rest.remove_prefix(static_cast<size_t>(n));
    }
    return 0;
}

int readAll(const Descriptor& fd, std::string& contents, size_t maxBytes) {
    char buffer[65536];
    for (;;) {
        const ssize_t n = ::read(fd.get(), buffer, sizeof buffer);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) return errno;
        if (n == 0) return 0;
        contents.append(buffer, static_cast<size_t>(n));
        if (contents.size() > maxBytes) return EFBIG;
    }
}

struct CloseDirectory {
    void operator()(DIR* directory) const { ::closedir(directory); }
};
using Directory = std::unique_ptr<DIR, CloseDirectory>;

// The names in a folder, without "." and "..". A folder that was removed meanwhile is an error, not an empty one.
int namesIn(const Descriptor& parent, const std::string& name, std::vector<std::string>& names, Directory& directory) {
    Descriptor fd(::openat(parent.get(), name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!fd) return fd.error() == ENOTDIR && isLink(parent, name) ? ELOOP : fd.error();
    directory.reset(::fdopendir(fd.get()));
    if (!directory) return errno;
    (void)fd.release();
    for (errno = 0; const dirent* entry = ::readdir(directory.get()); errno = 0) {
        const std::string_view found = entry->d_name;
        if (found != "." && found != "..") names.emplace_back(found);
    }
    if (errno != 0) return errno;
    struct stat status;
    if (::fstat(::dirfd(directory.get()), &status) != 0) return errno;
    return status.st_nlink == 0 ? ENOENT : 0;
}

int removeIn(const Descriptor& folder, const std::string& name, int depth) {
    if (::unlinkat(folder.get(), name.c_str(), 0) == 0) return 0;
    if (errno != EISDIR && errno != EPERM) return errno;
    const int whenFile = errno;
    if (depth >= kDeepestTree) return ELOOP;
    std::vector<std::string> names;
    Directory directory;
    int error = namesIn(folder, name, names, directory);
    if (error != 0) return error == ENOTDIR ? whenFile : error;
    const Descriptor inside(::dup(::dirfd(directory.get())));
    if (!inside) return inside.error();
    for (const std::string& entry : names)
        if (const int failed = removeIn(inside, entry, depth + 1); failed != 0 && failed != ENOENT) error = failed;
    if (error != 0) return error;
    return ::unlinkat(folder.get(), name.c_str(), AT_REMOVEDIR) == 0 ? 0 : errno;
}

FileInfo infoOf(const std::string& name, const struct stat& status) {
    FileInfo info;
    info.displayName = name;
    info.isCollection = S_ISDIR(status.st_mode);
    info.size = static_cast<uint64_t>(status.st_size);
    info.modificationdate =
        Date(static_cast<double>(status.st_mtim.tv_sec) + static_cast<double>(status.st_mtim.tv_nsec) / 1e9);
    return info;
}

} // namespace

int LocalFiles::read(const std::string& path, std::string& contents, size_t maxBytes) const {
    contents.clear();
    const auto place = placeOf(path, _root);
    if (!place) return EINVAL;
    const Descriptor folder = parentOf(*place);
    if (!folder) return folder.error();
    const Descriptor fd(
        ::openat(folder.get(), place->below.back().c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    if (!fd) return fd.error();
    if (!S_ISREG(statusOf(fd).st_mode)) return EINVAL;
    return readAll(fd, contents, maxBytes);
}

int LocalFiles::write(const std::string& path, std::string_view contents, std::optional<mode_t> mode) const {
    const auto place = placeOf(path, _root);
    if (!place) return EINVAL;
    const Descriptor folder = parentOf(*place);
    if (!folder) return folder.error();
    const Descriptor fd(::openat(folder.get(), place->below.back().c_str(),
                                 O_WRONLY | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0666));
    if (!fd) return fd.error();
    const struct stat status = statusOf(fd);
    if (!S_ISREG(status.st_mode)) return EINVAL;
    if (status.st_nlink > 1) return EMLINK;
    if (::ftruncate(fd.get(), 0) != 0) return errno;
    const int error = writeAll(fd, contents);
    if (mode && ::fchmod(fd.get(), *mode) != 0) return error != 0 ? error : errno == EPERM ? 0 : errno;
    return error;
}

int LocalFiles::makeDirectories(const std::string& path, mode_t mode) const {
    // From "/" down without a root, so that every missing parent is made.
    const auto components = componentsOf(path);
    if (!components || (!_root.empty() && path != _root && !placeOf(path, _root))) return EINVAL;
    const size_t trusted = componentsOf(_root).value_or(std::vector<std::string>()).size();
    Descriptor folder(::open("/", kFolder));
    for (size_t i = 0; folder && i < components->size(); ++i) {
        const std::string& name = (*components)[i];
        const bool mayBeLink = i < trusted || (_root.empty() && i + 1 < components->size());
        const auto opened = [&] {
            return mayBeLink ? Descriptor(::openat(folder.get(), name.c_str(), kFolder)) : folderIn(folder, name);
        };
        Descriptor next = opened();
        if (!next && next.error() == ENOENT) {
            if (const int error = makeFolder(folder, name, mode)) return error;
            next = opened();
        }
        folder = std::move(next);
    }
    return folder ? 0 : folder.error();
}

bool LocalFiles::isDirectory(const std::string& path) const {
    const auto place = placeOf(path, _root);
    if (!place) return false;
    const Descriptor folder = parentOf(*place);
    struct stat status;
    return folder && ::fstatat(folder.get(), place->below.back().c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0 &&
           S_ISDIR(status.st_mode);
}

int LocalFiles::rename(const std::string& from, const std::string& to) const {
    const auto source = placeOf(from, _root), target = placeOf(to, _root);
    if (!source || !target) return EINVAL;
    const Descriptor here = parentOf(*source), there = parentOf(*target);
    if (!here || !there) return here ? there.error() : here.error();
    return ::renameat(here.get(), source->below.back().c_str(), there.get(), target->below.back().c_str()) == 0 ? 0
                                                                                                                : errno;
}

int LocalFiles::removeFile(const std::string& path) const {
    const auto place = placeOf(path, _root);
    if (!place) return EINVAL;
    const Descriptor folder = parentOf(*place);
    if (!folder) return folder.error();
    return ::unlinkat(folder.get(), place->below.back().c_str(), 0) == 0 ? 0 : errno;
}

int LocalFiles::removeTree(const std::string& path) const {
    const auto place = placeOf(path, _root);
    if (!place) return EINVAL;
    const Descriptor folder = parentOf(*place);
    return folder ? removeIn(folder, place->below.back(), 0) : folder.error();
}

int LocalFiles::list(const std::string& path, FileListing& out) const {
    out.clear();
    const auto place = placeOf(path, _root);
    if (!place) return EINVAL;
    const Descriptor folder = parentOf(*place);
    if (!folder) return folder.error();
    std::vector<std::string> names;
    Directory directory;
    if (const int error = namesIn(folder, place->below.back(), names, directory)) return error;
    for (const std::string& name : names) {
        struct stat status;
        if (::fstatat(::dirfd(directory.get()), name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) {
            if (errno == ENOENT) continue; // removed while the listing was made
            return errno;
        }
        if (S_ISREG(status.st_mode) || S_ISDIR(status.st_mode)) out[path + "/" + name] = infoOf(name, status);
    }
    return 0;
}

} // namespace rolvane
