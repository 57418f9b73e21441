#include "foundation/Paths.h"

#include "foundation/SystemError.h"
#include "foundation/TemporaryFiles.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <fcntl.h>
#include <fmt/format.h>
#include <pwd.h>
#include <sys/file.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>
#include <utility>
#include <vector>

namespace rolvane {

namespace {

class Descriptor {
public:
    explicit Descriptor(int fd) : _fd(fd) {}
    Descriptor(const Descriptor&) = delete;
    Descriptor& operator=(const Descriptor&) = delete;
    ~Descriptor() {
        if (_fd >= 0) ::close(_fd);
    }
    int get() const { return _fd; }
    explicit operator bool() const { return _fd >= 0; }
    // False with errno set when the last write did not get through.
    bool close() { return ::close(std::exchange(_fd, -1)) == 0; }

private:
    int _fd;
};

// Unlinks the file at the end unless it was kept. It is locked until then, so that nobody takes it for one that a
// killed process has left.
class TemporaryFile {
public:
    explicit TemporaryFile(const std::string& beside)
        : _path(beside + kTemporaryMark + "XXXXXX"), _fd(::mkostemp(_path.data(), O_CLOEXEC)),
          _lock(_fd ? ::fcntl(_fd.get(), F_DUPFD_CLOEXEC, 0) : -1) {
        if (!_fd) throw cxSystemException("make a temporary file beside", beside, errno);
        if (_lock) ::flock(_lock.get(), LOCK_EX | LOCK_NB);
    }
    TemporaryFile(const TemporaryFile&) = delete;
    TemporaryFile& operator=(const TemporaryFile&) = delete;
    ~TemporaryFile() {
        if (!_kept) ::unlink(_path.c_str());
    }
    Descriptor& descriptor() { return _fd; }
    bool renameTo(const std::string& path) {
        _kept = ::rename(_path.c_str(), path.c_str()) == 0;
        return _kept;
    }

private:
    std::string _path;
    Descriptor _fd, _lock; // one file; the lock lasts until both are closed
    bool _kept = false;
};

// The environment's absolute path, or nothing: a relative one is to be ignored (XDG Base Directory Specification).
std::string absoluteFromEnvironment(const char* name) {
    const char* value = std::getenv(name);
    return value && value[0] == '/' ? value : "";
}

struct Account {
    std::string name, home;
};

Account accountOfProcess() {
    std::vector<char> buffer(4096);
    passwd entry{};
    passwd* found = nullptr;
    while (::getpwuid_r(::geteuid(), &entry, buffer.data(), buffer.size(), &found) == ERANGE)
        buffer.resize(buffer.size() * 2);
    if (!found) return {};
    return {entry.pw_name ? entry.pw_name : "", entry.pw_dir ? entry.pw_dir : ""};
}

std::string madePrivately(const std::string& directory) {
    CXPathUtils_MakeCompletePath(directory, 0700);
    return directory;
}

std::string baseDirectory(const char* variable, const char* belowHome) {
    std::string base = absoluteFromEnvironment(variable);
    if (base.empty()) base = homeDirectory() + belowHome;
    while (base.size() > 1 && base.back() == '/') base.pop_back();
    return madePrivately(base + "/rolvane");
}

bool isDirectory(const std::string& path) {
    struct stat s {};
    return ::stat(path.c_str(), &s) == 0 && S_ISDIR(s.st_mode);
}

// Sets the mode of a directory that was made just now; a link put in its place meanwhile is not followed.
void setModeOfNewDirectory(const std::string& path, mode_t mode) {
    const Descriptor fd(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!fd || ::fchmod(fd.get(), mode) != 0) throw cxSystemException("set the mode of the directory", path, errno);
}

void makeDirectory(const std::string& path, mode_t mode) {
    if (::mkdir(path.c_str(), mode | S_IRWXU) == 0) {
        setModeOfNewDirectory(path, mode);
        return;
    }
    const int error = errno;
    if (isDirectory(path)) return; // made by another process meanwhile, or not ours to write but there
    throw cxSystemException("make the directory", path, error == EEXIST ? ENOTDIR : error);
}

std::string parentOf(const std::string& path) {
    const size_t slash = path.rfind('/');
    if (slash == std::string::npos) return ".";
    return slash == 0 ? "/" : path.substr(0, slash);
}

bool writeAll(int fd, std::string_view rest) {
    while (!rest.empty()) {
        const ssize_t n = ::write(fd, rest.data(), rest.size());
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) return false;
        rest.remove_prefix(static_cast<size_t>(n));
    }
    return true;
}

void syncDirectory(const std::string& path) {
    const Descriptor fd(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!fd || (::fsync(fd.get()) != 0 && errno != EINVAL)) // EINVAL: the file system has no such operation
        throw cxSystemException("make durable the directory", path, errno);
}

[[noreturn]] void refuseSize(const std::string& path, size_t maxBytes) {
    throw CXException(kCXFileException, fmt::format("cannot read \"{}\": it is larger than {} bytes", path, maxBytes));
}

} // namespace

std::string homeDirectory() {
    if (std::string home = absoluteFromEnvironment("HOME"); !home.empty()) return home;
    if (std::string home = accountOfProcess().home; !home.empty() && home[0] == '/') return home;
    throw CXException(kCXFileException, "there is no home directory: set HOME to an absolute path");
}

std::string loginUserName() {
    const std::string name = accountOfProcess().name;
    return name.empty() ? std::to_string(::geteuid()) : name;
}

std::string dataDirectory() {
    return baseDirectory("XDG_DATA_HOME", "/.local/share");
}
std::string stateDirectory() {
    return baseDirectory("XDG_STATE_HOME", "/.local/state");
}
std::string cacheDirectory() {
    return baseDirectory("XDG_CACHE_HOME", "/.cache");
}
std::string configDirectory() {
    return baseDirectory("XDG_CONFIG_HOME", "/.config");
}

std::string runtimeDirectory() {
    if (absoluteFromEnvironment("XDG_RUNTIME_DIR").empty()) return madePrivately(stateDirectory() + "/run");
    return baseDirectory("XDG_RUNTIME_DIR", "");
}

void CXPathUtils_MakeCompletePath(const std::string& path, mode_t mode) {
    if (isDirectory(path)) return;
    if (path.empty() || path.find('\0') != std::string::npos)
        throw CXException(kCXInvalidArgumentException, "cannot make a directory: the path is empty or has a zero byte");
    for (size_t at = path.find_first_not_of('/'); at != std::string::npos;) {
        const size_t end = path.find('/', at);
        const std::string step = path.substr(0, end);
        if (!isDirectory(step)) makeDirectory(step, mode);
        at = end == std::string::npos ? end : path.find_first_not_of('/', end);
    }
}

namespace {

void replaceFile(const std::string& path, const std::string& contents, mode_t mode, bool durably) {
    TemporaryFile temporary(path);
    Descriptor& fd = temporary.descriptor();
    if (::fchmod(fd.get(), mode) != 0 || !writeAll(fd.get(), contents) || (durably && ::fsync(fd.get()) != 0) ||
        !fd.close() || !temporary.renameTo(path))
        throw cxSystemException("write", path, errno);
    if (durably) syncDirectory(parentOf(path));
}

} // namespace

void writeFileDurably(const std::string& path, const std::string& contents, mode_t mode) {
    replaceFile(path, contents, mode, true);
}

void writeFileWhole(const std::string& path, const std::string& contents, mode_t mode) {
    replaceFile(path, contents, mode, false);
}

std::string readFile(const std::string& path, size_t maxBytes) {
    const Descriptor fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK)); // a pipe must not hold us up
    struct stat s {};
    if (!fd || ::fstat(fd.get(), &s) != 0) throw cxSystemException("read", path, errno);
    if (!S_ISREG(s.st_mode))
        throw CXException(kCXFileException, fmt::format("cannot read \"{}\": it is not a regular file", path));
    if (static_cast<uint64_t>(s.st_size) > maxBytes) refuseSize(path, maxBytes);
    std::string text(static_cast<size_t>(s.st_size) + 1, '\0'); // one more, to see the end without another turn
    size_t used = 0;
    for (;;) {
        const ssize_t n = ::read(fd.get(), text.data() + used, text.size() - used);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) throw cxSystemException("read", path, errno);
        used += static_cast<size_t>(n);
        if (used > maxBytes) refuseSize(path, maxBytes);
        if (n == 0) break;
        if (used == text.size()) text.resize(text.size() * 2);
    }
    text.resize(used);
    return text;
}

namespace {

// Random bytes of a thread's own, drawn many at a time; a process that was forked off draws its own.
void drawRandom(std::array<uint8_t, 16>& out) {
    struct Pool {
        std::array<uint8_t, 256> bytes; // as many as the kernel gives at once whatever happens
        size_t used = sizeof bytes;
        pid_t process = 0;
    };
    thread_local Pool pool;
    if (pool.used + out.size() > pool.bytes.size() || pool.process != ::getpid()) {
        if (::getrandom(pool.bytes.data(), pool.bytes.size(), 0) != static_cast<ssize_t>(pool.bytes.size()))
            throw cxSystemException("draw random numbers from", "getrandom", errno);
        pool.used = 0;
        pool.process = ::getpid();
    }
    std::copy_n(pool.bytes.begin() + static_cast<std::ptrdiff_t>(pool.used), out.size(), out.begin());
    pool.used += out.size();
}

} // namespace

std::string makeUUID() {
    constexpr std::string_view kDigits = "0123456789ABCDEF";
    std::array<uint8_t, 16> b{};
    drawRandom(b);
    b[6] = static_cast<uint8_t>((b[6] & 0x0f) | 0x40);
    b[8] = static_cast<uint8_t>((b[8] & 0x3f) | 0x80);
    std::string out;
    out.reserve(36);
    for (size_t i = 0; i < b.size(); ++i) {
        if (i == 4 || i == 6 || i == 8 || i == 10) out += '-';
        out += kDigits[b[i] >> 4];
        out += kDigits[b[i] & 15];
    }
    return out;
}

} // namespace rolvane
