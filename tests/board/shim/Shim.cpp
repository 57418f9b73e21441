// Loaded before a program's other libraries (LD_PRELOAD): counts what the program does to files below one directory and
// sends to servers, and lets one of these operations fail, or ends the process before it. See FaultControl.h.

#include "../FaultControl.h"

#include <array>
#include <cerrno>
#include <csignal>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dlfcn.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/time.h>
#include <sys/uio.h>
#include <time.h>
#include <unistd.h>

namespace {

using rolvane::board::FaultControl;
using rolvane::board::RecordedChange;
using Path = std::array<char, 512>;

template <class Function>
Function* next(Function*, const char* name) {
    return reinterpret_cast<Function*>(::dlsym(RTLD_NEXT, name));
}
#define REAL(name) static const auto real = next(&::name, #name)

FaultControl* control() {
    static FaultControl* const shared = []() -> FaultControl* {
        const char* path = std::getenv(rolvane::board::kControlVariable);
        const int fd = path ? static_cast<int>(::syscall(SYS_openat, AT_FDCWD, path, O_RDWR | O_CLOEXEC)) : -1;
        if (fd < 0) return nullptr;
        void* page = ::mmap(nullptr, sizeof(FaultControl), PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
        ::close(fd);
        return page == MAP_FAILED ? nullptr : static_cast<FaultControl*>(page);
    }();
    return shared;
}

bool isBelow(const char* path, const FaultControl& c) {
    const size_t length = std::strlen(c.root);
    return length > 0 && std::strncmp(path, c.root, length) == 0 && path[length] == '/';
}

// The path of an open file; empty when it has none.
Path pathOf(int fd) {
    Path link{}, path{};
    std::snprintf(link.data(), link.size(), "/proc/self/fd/%d", fd);
    if (::readlink(link.data(), path.data(), path.size() - 1) < 0 || path[0] != '/') path[0] = '\0';
    return path;
}
Path absolute(int directory, const char* path) {
    Path whole{};
    int length = 0;
    if (path[0] == '/')
        length = std::snprintf(whole.data(), whole.size(), "%s", path);
    else if (directory != AT_FDCWD)
        length = std::snprintf(whole.data(), whole.size(), "%s/%s", pathOf(directory).data(), path);
    if (length < 0 || static_cast<size_t>(length) >= whole.size()) whole[0] = '\0';
    return whole;
}

bool isOnNetwork(int fd) {
    sockaddr_storage name{};
    socklen_t length = sizeof name;
    if (::getsockname(fd, reinterpret_cast<sockaddr*>(&name), &length) != 0) return false;
    return name.ss_family == AF_INET || name.ss_family == AF_INET6;
}

// Whether the operation that comes next meets the fault; ends the process when that is the fault.
bool meets(FaultControl& c, const char* operation, const char* path) {
    const int64_t number = c.count++, at = c.at;
    if (at < 0 || number < at || number - at >= c.length) return false;
    ++c.met;
    std::snprintf(c.where, sizeof c.where, "%s %s", operation, path);
    if (c.kind == FaultControl::kill) {
        ::kill(::getpid(), SIGKILL);
        for (;;) ::pause();
    }
    return true;
}

enum class Needs { room, disk, change }; // room for bytes; the device; only that something may change

// The error that the operation on a file ends with; 0 for none.
int refused(const char* operation, const char* path, Needs needs) {
    const int before = errno;
    FaultControl* c = control();
    const bool met = c && path[0] != '\0' && isBelow(path, *c) && meets(*c, operation, path);
    errno = before;
    if (!met) return 0;
    if (c->kind == FaultControl::fullDisk) return needs == Needs::room ? ENOSPC : 0;
    if (c->kind == FaultControl::failingDisk) return EIO;
    return needs == Needs::disk ? 0 : EROFS;
}
template <class Result>
bool isRefused(const char* operation, const char* path, Needs needs, Result& result) {
    const int error = refused(operation, path, needs);
    if (error == 0) return false;
    errno = error;
    result = -1;
    return true;
}

void record(RecordedChange::What what, const char* path, const char* other = "", int64_t offset = 0,
            const void* bytes = nullptr, int64_t size = 0) {
    FaultControl* c = control();
    if (!c || c->record[0] == '\0' || !isBelow(path, *c)) return;
    const int before = errno;
    static const int file = ::open(c->record, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
    RecordedChange change{what, static_cast<int32_t>(std::strlen(path)), static_cast<int32_t>(std::strlen(other)),
                          offset, bytes ? size : 0};
    const std::array<iovec, 4> parts{{{&change, sizeof change},
                                      {const_cast<char*>(path), static_cast<size_t>(change.pathLength)},
                                      {const_cast<char*>(other), static_cast<size_t>(change.otherLength)},
                                      {const_cast<void*>(bytes), static_cast<size_t>(change.size)}}};
    static const auto real = next(&::writev, "writev");
    [[maybe_unused]] const ssize_t n = real(file, parts.data(), parts.size());
    errno = before;
}

// Around a sending of bytes to a server: two operations, before it and after the answer.
template <class Send>
ssize_t sending(int fd, const Send& send) {
    FaultControl* c = control();
    if (!c || c->network == 0 || !isOnNetwork(fd)) return send();
    meets(*c, "before sending to", "the store");
    const ssize_t sent = send();
    const int error = errno;
    if (c->at == c->count) {
        constexpr int kMilliseconds = 2000;
        pollfd answer{fd, POLLIN, 0};
        ::poll(&answer, 1, kMilliseconds);
    }
    meets(*c, "after sending to", "the store");
    errno = error;
    return sent;
}

bool exists(const char* path) {
    const int before = errno;
    struct stat info {};
    const bool found = ::lstat(path, &info) == 0;
    errno = before;
    return found;
}

template <class Open>
int opening(int directory, const char* path, int flags, const Open& open) {
    FaultControl* c = control();
    if (!c || (flags & (O_CREAT | O_WRONLY | O_RDWR)) == 0) return open();
    const Path whole = absolute(directory, path);
    if (!isBelow(whole.data(), *c)) return open();
    const bool makes = (flags & O_CREAT) != 0 && !exists(whole.data());
    int failed = 0;
    if (makes && isRefused("create", whole.data(), Needs::room, failed)) return failed;
    if (!makes && c->kind == FaultControl::readOnlyDisk && c->at >= 0 && c->count > c->at &&
        c->count - c->at < c->length) {
        errno = EROFS;
        return -1;
    }
    const int fd = open();
    if (fd >= 0 && makes) record(RecordedChange::create, whole.data());
    if (fd >= 0 && !makes && (flags & O_TRUNC) != 0) record(RecordedChange::truncate, whole.data());
    return fd;
}

off_t positionOf(int fd, ssize_t written) {
    return ::lseek(fd, 0, SEEK_CUR) - written;
}

int64_t secondsLater() {
    FaultControl* c = control();
    return c ? c->clock.load() : 0;
}

} // namespace

extern "C" {

ssize_t write(int fd, const void* bytes, size_t size) {
    REAL(write);
    const Path path = pathOf(fd);
    if (path[0] == '\0') return sending(fd, [&] { return real(fd, bytes, size); });
    ssize_t result = 0;
    if (isRefused("write", path.data(), Needs::room, result)) return result;
    result = real(fd, bytes, size);
    if (result > 0 && control() && control()->record[0] != '\0')
        record(RecordedChange::write, path.data(), "", positionOf(fd, result), bytes, result);
    return result;
}

ssize_t writev(int fd, const iovec* parts, int count) {
    REAL(writev);
    const Path path = pathOf(fd);
    if (path[0] == '\0') return sending(fd, [&] { return real(fd, parts, count); });
    ssize_t result = 0;
    if (isRefused("write", path.data(), Needs::room, result)) return result;
    result = real(fd, parts, count);
    if (result <= 0 || !control() || control()->record[0] == '\0') return result;
    off_t at = positionOf(fd, result);
    for (int i = 0; i < count; at += static_cast<off_t>(parts[i].iov_len), ++i)
        record(RecordedChange::write, path.data(), "", at, parts[i].iov_base, static_cast<int64_t>(parts[i].iov_len));
    return result;
}

ssize_t pwrite(int fd, const void* bytes, size_t size, off_t at) {
    REAL(pwrite);
    const Path path = pathOf(fd);
    ssize_t result = 0;
    if (isRefused("pwrite", path.data(), Needs::room, result)) return result;
    result = real(fd, bytes, size, at);
    if (result > 0) record(RecordedChange::write, path.data(), "", at, bytes, result);
    return result;
}
ssize_t pwrite64(int fd, const void* bytes, size_t size, off64_t at) {
    return ::pwrite(fd, bytes, size, at);
}

int ftruncate(int fd, off_t size) noexcept {
    REAL(ftruncate);
    const Path path = pathOf(fd);
    int result = 0;
    if (isRefused("ftruncate", path.data(), Needs::room, result)) return result;
    result = real(fd, size);
    if (result == 0) record(RecordedChange::truncate, path.data(), "", size);
    return result;
}
int ftruncate64(int fd, off64_t size) noexcept {
    return ::ftruncate(fd, size);
}

int fsync(int fd) {
    REAL(fsync);
    const Path path = pathOf(fd);
    int result = 0;
    if (isRefused("fsync", path.data(), Needs::disk, result)) return result;
    result = real(fd);
    struct stat info {};
    if (result == 0)
        record(::fstat(fd, &info) == 0 && S_ISDIR(info.st_mode) ? RecordedChange::syncDirectory : RecordedChange::sync,
               path.data());
    return result;
}
int fdatasync(int fd) {
    REAL(fdatasync);
    const Path path = pathOf(fd);
    int result = 0;
    if (isRefused("fdatasync", path.data(), Needs::disk, result)) return result;
    result = real(fd);
    if (result == 0) record(RecordedChange::sync, path.data());
    return result;
}

int rename(const char* from, const char* to) noexcept {
    REAL(rename);
    const Path path = absolute(AT_FDCWD, from), other = absolute(AT_FDCWD, to);
    int result = 0;
    if (isRefused("rename", other.data(), Needs::change, result)) return result;
    result = real(from, to);
    if (result == 0) record(RecordedChange::rename, path.data(), other.data());
    return result;
}
int renameat(int fromDirectory, const char* from, int toDirectory, const char* to) noexcept {
    REAL(renameat);
    const Path path = absolute(fromDirectory, from), other = absolute(toDirectory, to);
    int result = 0;
    if (isRefused("rename", other.data(), Needs::change, result)) return result;
    result = real(fromDirectory, from, toDirectory, to);
    if (result == 0) record(RecordedChange::rename, path.data(), other.data());
    return result;
}

int unlink(const char* name) noexcept {
    REAL(unlink);
    const Path path = absolute(AT_FDCWD, name);
    int result = 0;
    if (exists(path.data()) && isRefused("unlink", path.data(), Needs::change, result)) return result;
    result = real(name);
    if (result == 0) record(RecordedChange::unlink, path.data());
    return result;
}
int unlinkat(int directory, const char* name, int flags) noexcept {
    REAL(unlinkat);
    const Path path = absolute(directory, name);
    int result = 0;
    if (exists(path.data()) && isRefused("unlink", path.data(), Needs::change, result)) return result;
    result = real(directory, name, flags);
    if (result == 0) record(RecordedChange::unlink, path.data());
    return result;
}
int remove(const char* name) noexcept {
    struct stat info {};
    return ::lstat(name, &info) == 0 && S_ISDIR(info.st_mode) ? ::rmdir(name) : ::unlink(name);
}
int mkdir(const char* name, mode_t mode) noexcept {
    REAL(mkdir);
    const Path path = absolute(AT_FDCWD, name);
    int result = 0;
    if (!exists(path.data()) && isRefused("mkdir", path.data(), Needs::room, result)) return result;
    result = real(name, mode);
    if (result == 0) record(RecordedChange::makeDirectory, path.data());
    return result;
}

#define OPENING(name)                                                                                                  \
    int name(const char* path, int flags, ...) {                                                                       \
        static const auto real = next(static_cast<int (*)(const char*, int, ...)>(&::name), #name);                    \
        va_list rest;                                                                                                  \
        va_start(rest, flags);                                                                                         \
        const mode_t mode = (flags & (O_CREAT | __O_TMPFILE)) != 0 ? va_arg(rest, mode_t) : 0;                         \
        va_end(rest);                                                                                                  \
        return opening(AT_FDCWD, path, flags, [&] { return real(path, flags, mode); });                                \
    }
OPENING(open)
OPENING(open64)
#undef OPENING

#define OPENING_AT(name)                                                                                               \
    int name(int directory, const char* path, int flags, ...) {                                                        \
        static const auto real = next(static_cast<int (*)(int, const char*, int, ...)>(&::name), #name);               \
        va_list rest;                                                                                                  \
        va_start(rest, flags);                                                                                         \
        const mode_t mode = (flags & (O_CREAT | __O_TMPFILE)) != 0 ? va_arg(rest, mode_t) : 0;                         \
        va_end(rest);                                                                                                  \
        return opening(directory, path, flags, [&] { return real(directory, path, flags, mode); });                    \
    }
OPENING_AT(openat)
OPENING_AT(openat64)
#undef OPENING_AT

ssize_t send(int fd, const void* bytes, size_t size, int flags) {
    REAL(send);
    return sending(fd, [&] { return real(fd, bytes, size, flags); });
}
ssize_t sendmsg(int fd, const msghdr* message, int flags) {
    REAL(sendmsg);
    return sending(fd, [&] { return real(fd, message, flags); });
}

// The clock. Certificates are judged by `time`, which therefore goes along for a day at most.
time_t time(time_t* where) noexcept {
    constexpr int64_t kDay = 86400;
    timespec now{};
    static const auto real = next(&::clock_gettime, "clock_gettime");
    real(CLOCK_REALTIME, &now);
    const int64_t later = secondsLater();
    if (later < kDay && later > -kDay) now.tv_sec += later;
    if (where) *where = now.tv_sec;
    return now.tv_sec;
}
int clock_gettime(clockid_t clock, timespec* now) noexcept {
    REAL(clock_gettime);
    const int result = real(clock, now);
    if (result == 0 && clock == CLOCK_REALTIME) now->tv_sec += secondsLater();
    return result;
}
int gettimeofday(timeval* now, void* zone) noexcept {
    REAL(gettimeofday);
    const int result = real(now, zone);
    if (result == 0) now->tv_sec += secondsLater();
    return result;
}

} // extern "C"
