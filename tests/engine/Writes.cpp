#include "Writes.h"

#include <atomic>
#include <cerrno>
#include <sqlite3.h>
#include <unistd.h>

namespace rolvane::test {

namespace {

std::atomic<bool (*)()> ask{nullptr};

bool refused() {
    bool (*const asked)() = ask;
    if (!asked || asked()) return false;
    errno = ENOSPC;
    return true;
}
ssize_t askingWrite(int fd, const void* bytes, size_t size) {
    return refused() ? -1 : ::write(fd, bytes, size);
}
ssize_t askingPwrite(int fd, const void* bytes, size_t size, off_t at) {
    return refused() ? -1 : ::pwrite(fd, bytes, size, at);
}
int askingTruncate(int fd, off_t size) {
    return refused() ? -1 : ::ftruncate(fd, size);
}
int askingUnlink(const char* path) {
    return refused() ? -1 : ::unlink(path);
}

template <class Function>
void replace(const char* name, Function* with) {
    sqlite3_vfs* vfs = sqlite3_vfs_find(nullptr);
    if (vfs->xGetSystemCall(vfs, name)) vfs->xSetSystemCall(vfs, name, reinterpret_cast<sqlite3_syscall_ptr>(with));
}

} // namespace

void interceptWrites(bool (*mayWrite)()) {
    ask = mayWrite;
    static const bool installed = [] {
        replace("write", askingWrite);
        replace("pwrite", askingPwrite);
        replace("pwrite64", askingPwrite);
        replace("ftruncate", askingTruncate);
        replace("unlink", askingUnlink);
        return true;
    }();
    (void)installed;
}

} // namespace rolvane::test
