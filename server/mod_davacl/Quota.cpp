#include "server/mod_davacl/Quota.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <dirent.h>
#include <fcntl.h>
#include <memory>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

namespace rolvane::davacl {
namespace {

// mod_dav_fs keeps properties in it, in files that count. It comes and goes with them, so it counts for nothing itself.
constexpr std::string_view kPropertyDirectory = ".DAV";
constexpr int kLineLength = 42;

struct CloseDirectory {
    void operator()(DIR* directory) const { closedir(directory); }
};

uint64_t roomOf(const struct stat& info) {
    return S_ISDIR(info.st_mode) ? kRoomUnit : roomOfBytes(static_cast<uint64_t>(info.st_size));
}

uint64_t roomOfMembers(int parent, const char* name) {
    const int file = openat(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    const std::unique_ptr<DIR, CloseDirectory> directory(file < 0 ? nullptr : fdopendir(file));
    if (!directory) {
        if (file >= 0) close(file);
        return 0;
    }
    uint64_t sum = 0;
    while (const dirent* entry = readdir(directory.get())) {
        const std::string_view member = entry->d_name;
        struct stat info {};
        if (member == "." || member == ".." || fstatat(file, entry->d_name, &info, AT_SYMLINK_NOFOLLOW) != 0) continue;
        if (!S_ISDIR(info.st_mode) || member != kPropertyDirectory) sum += roomOf(info);
        if (S_ISDIR(info.st_mode)) sum += roomOfMembers(file, entry->d_name);
    }
    return sum;
}

std::string_view trimmed(std::string_view text) {
    const size_t from = text.find_first_not_of(" \t\r");
    return from == std::string_view::npos ? std::string_view()
                                          : text.substr(from, text.find_last_not_of(" \t\r") - from + 1);
}

} // namespace

std::optional<uint64_t> sizeOf(std::string_view text) {
    if (text == "none") return kNoQuota;
    uint64_t number = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
    if (error != std::errc() || end == text.data()) return std::nullopt;
    const std::string_view unit(end, static_cast<size_t>(text.data() + text.size() - end));
    if (unit.empty()) return number == kNoQuota ? std::nullopt : std::optional(number);
    const size_t power = unit.size() == 1 ? std::string_view("KMGT").find(unit.front()) : std::string_view::npos;
    if (power == std::string_view::npos) return std::nullopt;
    const auto shift = static_cast<unsigned>(10 * (power + 1));
    return number >> (63 - shift) ? std::nullopt : std::optional(number << shift);
}

std::optional<uint64_t> quotaInFile(std::string_view text, std::string_view user) {
    std::optional<uint64_t> found;
    while (!text.empty()) {
        const std::string_view line = text.substr(0, text.find('\n'));
        text.remove_prefix(std::min(line.size() + 1, text.size()));
        const size_t colon = line.find(':');
        if (colon == std::string_view::npos || trimmed(line.substr(0, colon)) != user) continue;
        // A line that cannot be read allows nothing: the administrator notices that, and no limit goes unnoticed.
        found = sizeOf(trimmed(line.substr(colon + 1))).value_or(0);
    }
    return found;
}

uint64_t roomOfBytes(uint64_t bytes) {
    return std::max<uint64_t>(1, bytes / kRoomUnit + (bytes % kRoomUnit != 0)) * kRoomUnit;
}

uint64_t roomTaken(const std::string& path, bool deep) {
    struct stat info {};
    if (lstat(path.c_str(), &info) != 0) return 0;
    return roomOf(info) + (deep && S_ISDIR(info.st_mode) ? roomOfMembers(AT_FDCWD, path.c_str()) : 0);
}

QuotaLedger::~QuotaLedger() {
    if (_file >= 0) close(_file);
}

bool QuotaLedger::open() {
    _file = ::open(_path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600);
    if (_file < 0) return false;
    while (flock(_file, LOCK_EX) != 0)
        if (errno != EINTR) return false;
    if (read()) return true;
    _used = roomTaken(_tree, true);
    return write();
}

bool QuotaLedger::read() {
    char line[kLineLength + 1] = {};
    if (pread(_file, line, kLineLength, 0) != kLineLength) return false;
    unsigned long long generation = 0, used = 0;
    if (std::sscanf(line, "%20llu %20llu", &generation, &used) != 2 || generation < _generation) return false;
    _generation = generation;
    _used = used;
    return true;
}

bool QuotaLedger::write() {
    char line[kLineLength + 1];
    std::snprintf(line, sizeof line, "%020llu %020llu\n", static_cast<unsigned long long>(_generation),
                  static_cast<unsigned long long>(_used));
    return pwrite(_file, line, kLineLength, 0) == kLineLength;
}

bool QuotaLedger::add(int64_t bytes) {
    if (bytes == 0) return true;
    const auto down = static_cast<uint64_t>(-bytes);
    _used = bytes > 0 ? _used + static_cast<uint64_t>(bytes) : _used - std::min(_used, down);
    return write();
}

} // namespace rolvane::davacl
