#include "server/mod_davacl/DiskMembers.h"

#include <algorithm>
#include <cerrno>
#include <dirent.h>
#include <fcntl.h>
#include <memory>
#include <unistd.h>

namespace rolvane::davacl {
namespace {

// mod_dav_fs keeps its own books in it and shows it to nobody.
constexpr std::string_view kPropertyDirectory = ".DAV";

uint64_t mixed(uint64_t h) {
    h = (h ^ (h >> 33)) * 0xff51afd7ed558ccdu;
    h = (h ^ (h >> 33)) * 0xc4ceb9fe1a85ec53u;
    return h ^ (h >> 33);
}

int64_t nanoseconds(const timespec& t) {
    return int64_t{t.tv_sec} * 1000000000 + t.tv_nsec;
}

uint64_t summed(std::string_view text, unsigned lane) {
    uint64_t h = 0x9e3779b97f4a7c15u * (lane + 1);
    for (const char c : text) h = (h ^ static_cast<unsigned char>(c)) * 0x100000001b3u;
    return h;
}

struct CloseDirectory {
    void operator()(DIR* directory) const { closedir(directory); }
};

} // namespace

uint64_t textHash(std::string_view text, unsigned lane) {
    return mixed(summed(text, lane));
}

uint64_t memberHash(std::string_view name, const struct stat& info, unsigned lane) {
    uint64_t h = summed(name, lane);
    for (const uint64_t part :
         {uint64_t{info.st_mode}, uint64_t{info.st_dev}, uint64_t{info.st_ino}, static_cast<uint64_t>(info.st_size),
          static_cast<uint64_t>(nanoseconds(info.st_mtim)), static_cast<uint64_t>(nanoseconds(info.st_ctim))})
        h = mixed(h + part);
    return h;
}

int64_t changeTime(const struct stat& info) {
    return std::max(nanoseconds(info.st_mtim), nanoseconds(info.st_ctim));
}

bool forEachDiskMember(int file, const std::function<void(const DiskMember&)>& take) {
    const std::unique_ptr<DIR, CloseDirectory> directory(fdopendir(file));
    if (!directory) {
        close(file);
        return false;
    }
    for (;;) {
        errno = 0;
        const dirent* entry = readdir(directory.get());
        if (!entry) return errno == 0;
        const std::string_view name = entry->d_name;
        if (name == "." || name == ".." || name == kPropertyDirectory) continue;
        struct stat own {
        }, target{};
        DiskMember member{name};
        if (fstatat(dirfd(directory.get()), entry->d_name, &own, AT_SYMLINK_NOFOLLOW) == 0) {
            member.info = &own;
            member.isLink = S_ISLNK(own.st_mode);
        }
        if (member.isLink && fstatat(dirfd(directory.get()), entry->d_name, &target, 0) == 0) member.info = &target;
        take(member);
    }
}

} // namespace rolvane::davacl
