#pragma once

#include <cstdint>
#include <functional>
#include <string_view>
#include <sys/stat.h>

namespace rolvane::davacl {

// An entry of a directory as the disk has it. What a link leads to is what a reader gets, so `info` tells of that.
struct DiskMember {
    std::string_view name;
    const struct stat* info = nullptr; // of the link itself when it leads nowhere; null: it has just been removed
    bool isLink = false;
};

// Calls back for each entry of the directory but ".", ".." and mod_dav_fs's own books; `file` is the directory, opened
// for reading, and is closed. False when it cannot be read to its end.
bool forEachDiskMember(int file, const std::function<void(const DiskMember&)>& take);

// A number that is another one when the entry's name, kind, inode, size or times are. Two lanes are independent.
uint64_t memberHash(std::string_view name, const struct stat& info, unsigned lane);
uint64_t textHash(std::string_view text, unsigned lane = 0);
// The later of an entry's two times, in nanoseconds since 1970.
int64_t changeTime(const struct stat& info);

} // namespace rolvane::davacl
