#include "server/mod_davacl/PasswordLines.h"

#include <algorithm>
#include <ctime>
#include <fcntl.h>
#include <iterator>
#include <unistd.h>

namespace rolvane::davacl {
namespace {

constexpr time_t kSettledSeconds = 2;

std::string_view trimmed(std::string_view text) {
    constexpr std::string_view kBlank = " \t\r\n\f\v";
    text.remove_prefix(std::min(text.find_first_not_of(kBlank), text.size()));
    return text.substr(0, text.find_last_not_of(kBlank) + 1);
}

bool same(const struct stat& one, const struct stat& other) {
    const auto equal = [](const timespec& a, const timespec& b) {
        return a.tv_sec == b.tv_sec && a.tv_nsec == b.tv_nsec;
    };
    return one.st_dev == other.st_dev && one.st_ino == other.st_ino && one.st_size == other.st_size &&
           equal(one.st_mtim, other.st_mtim) && equal(one.st_ctim, other.st_ctim);
}

bool isSettled(const struct stat& state) {
    timespec now{};
    clock_gettime(CLOCK_REALTIME, &now);
    return now.tv_sec - std::max(state.st_mtim.tv_sec, state.st_ctim.tv_sec) > kSettledSeconds;
}

std::optional<std::string> textOf(int file) {
    std::string text;
    char part[65536];
    for (ssize_t count = 0; (count = ::read(file, part, sizeof part)) != 0;) {
        if (count < 0) return std::nullopt;
        text.append(part, static_cast<size_t>(count));
    }
    return text;
}

} // namespace

PasswordHashes passwordHashes(std::string_view text) {
    PasswordHashes hashes;
    while (!text.empty()) {
        const size_t end = std::min(text.find('\n'), text.size());
        const std::string_view line = trimmed(text.substr(0, end));
        text.remove_prefix(std::min(end + 1, text.size()));
        const size_t colon = line.find(':');
        if (line.empty() || line.front() == '#' || colon == std::string_view::npos) continue;
        const std::string_view rest = line.substr(colon + 1);
        hashes.try_emplace(std::string(line.substr(0, colon)), rest.substr(0, rest.find(':')));
    }
    return hashes;
}

std::string hashInstead(const PasswordHashes& hashes, uint64_t number) {
    // Of a random password that nobody knows, with the cost that the private store uses.
    constexpr const char* kNobodys = "$2y$10$xrCjQIp6x6sZd06o8G6sMOimJvwB/nwR18YXUwNsPuDRj4GA68g2u";
    if (hashes.empty()) return kNobodys;
    return std::next(hashes.begin(), static_cast<ptrdiff_t>(number % hashes.size()))->second;
}

std::shared_ptr<const PasswordHashes> PasswordLines::read(const std::string& path) {
    struct stat state {};
    const std::lock_guard lock(_mutex);
    File& known = _files[path];
    if (known.hashes && known.settled && stat(path.c_str(), &state) == 0 && same(state, known.state))
        return known.hashes;
    known = File();
    const int file = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (file < 0) return nullptr;
    const bool seen = fstat(file, &state) == 0;
    const bool settled = seen && isSettled(state); // before it is read: a change in between makes it another file
    const auto text = seen ? textOf(file) : std::nullopt;
    close(file);
    if (!text) return nullptr;
    known = {state, settled, std::make_shared<const PasswordHashes>(passwordHashes(*text))};
    return known.hashes;
}

PasswordLines::Found PasswordLines::find(const std::string& path, std::string_view user) {
    const auto hashes = read(path);
    if (!hashes) return {};
    const auto found = hashes->find(user);
    if (found == hashes->end()) return {Answer::unknown, {}, hashes};
    return {Answer::known, found->second};
}

} // namespace rolvane::davacl
