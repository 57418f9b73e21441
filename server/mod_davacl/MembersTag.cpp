#include "server/mod_davacl/MembersTag.h"

#include "server/mod_davacl/DiskMembers.h"

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstdio>
#include <fcntl.h>
#include <string_view>
#include <sys/stat.h>
#include <unistd.h>

namespace rolvane::davacl {
namespace {

// The order in which a directory is read is the file system's, so the entries' sums are added up.
struct Sum {
    std::array<uint64_t, 2> lanes{};
    uint64_t count = 0;
    int64_t newest = 0;

    void add(std::string_view name, const struct stat& s) {
        for (unsigned lane = 0; lane < lanes.size(); ++lane) lanes[lane] += memberHash(name, s, lane);
        ++count;
        newest = std::max(newest, changeTime(s));
    }
};

} // namespace

std::optional<std::string> membersTag(const std::string& path, int64_t now) {
    const int file = open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    struct stat s {};
    if (file < 0) return std::nullopt;
    if (fstat(file, &s) != 0) {
        close(file);
        return std::nullopt;
    }
    Sum sum;
    sum.add(".", s);
    bool whole = true;
    const bool read = forEachDiskMember(file, [&](const DiskMember& member) {
        if (member.info)
            sum.add(member.name, *member.info);
        else
            whole = false; // it is being removed
    });
    if (!read || !whole) return std::nullopt;
    if (sum.newest > now - static_cast<int64_t>(kSettleSeconds * 1e9)) return std::nullopt;
    char text[64];
    std::snprintf(text, sizeof text, "%llx-%016llx%016llx", static_cast<unsigned long long>(sum.count),
                  static_cast<unsigned long long>(sum.lanes[0]), static_cast<unsigned long long>(sum.lanes[1]));
    return text;
}

} // namespace rolvane::davacl
