#include "server/mod_davacl/MembersTag.h"

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstdio>
#include <ctime>
#include <dirent.h>
#include <fcntl.h>
#include <memory>
#include <string_view>
#include <sys/stat.h>
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

// The order in which a directory is read is the file system's, so the entries' sums are added up.
struct Sum {
    std::array<uint64_t, 2> lanes{};
    uint64_t count = 0;
    int64_t newest = 0;

    void add(std::string_view name, const struct stat& s) {
        for (size_t lane = 0; lane < lanes.size(); ++lane) {
            uint64_t h = 0x9e3779b97f4a7c15u * (lane + 1);
            for (const char c : name) h = (h ^ static_cast<unsigned char>(c)) * 0x100000001b3u;
            for (const uint64_t part :
                 {uint64_t{s.st_mode}, uint64_t{s.st_dev}, uint64_t{s.st_ino}, static_cast<uint64_t>(s.st_size),
                  static_cast<uint64_t>(nanoseconds(s.st_mtim)), static_cast<uint64_t>(nanoseconds(s.st_ctim))})
                h = mixed(h + part);
            lanes[lane] += h;
        }
        ++count;
        newest = std::max({newest, nanoseconds(s.st_mtim), nanoseconds(s.st_ctim)});
    }
};

struct CloseDirectory {
    void operator()(DIR* directory) const { closedir(directory); }
};

} // namespace

std::optional<std::string> membersTag(const std::string& path, int64_t now) {
    const std::unique_ptr<DIR, CloseDirectory> directory(opendir(path.c_str()));
    struct stat s {};
    if (!directory || fstat(dirfd(directory.get()), &s) != 0) return std::nullopt;
    Sum sum;
    sum.add(".", s);
    while (const dirent* entry = readdir(directory.get())) {
        const std::string_view name = entry->d_name;
        if (name == "." || name == ".." || name == kPropertyDirectory) continue;
        // What a link leads to is what a reader gets; one that leads nowhere is a member, too.
        if (fstatat(dirfd(directory.get()), entry->d_name, &s, 0) != 0 &&
            fstatat(dirfd(directory.get()), entry->d_name, &s, AT_SYMLINK_NOFOLLOW) != 0)
            return std::nullopt; // it is being removed
        sum.add(name, s);
    }
    if (sum.newest > now - static_cast<int64_t>(kSettleSeconds * 1e9)) return std::nullopt;
    char text[64];
    std::snprintf(text, sizeof text, "%llx-%016llx%016llx", static_cast<unsigned long long>(sum.count),
                  static_cast<unsigned long long>(sum.lanes[0]), static_cast<unsigned long long>(sum.lanes[1]));
    return text;
}

} // namespace rolvane::davacl
