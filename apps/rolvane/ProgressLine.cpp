#include "ProgressLine.h"

#include "SafeText.h"

#include <algorithm>
#include <fmt/format.h>

namespace rolvane::cli {

namespace {

constexpr size_t kOrdinaryColumns = 80;
constexpr size_t kLongestBar = 40, kShortestBar = 10;
constexpr size_t kAroundBar = 8; // " [", "] " and "100%"
constexpr size_t kLeastNote = 4;

} // namespace

std::string progressLine(const std::string& label, int percent, const std::string& note, size_t columns) {
    // The last column stays free: some terminals wrap as soon as it is written.
    const size_t room = (columns == 0 ? kOrdinaryColumns : std::max<size_t>(columns, 2)) - 1;
    const std::string end = fmt::format("{:3}%", percent);
    if (room < kAroundBar + kShortestBar + 1) return cutTo(end, room);
    const std::string name = cutTo(label, room - kAroundBar - kShortestBar);
    const size_t left = room - columnsOf(name) - kAroundBar;
    const size_t width = std::clamp(left, kShortestBar, kLongestBar);
    const size_t full = static_cast<size_t>(percent) * width / 100;
    std::string line = fmt::format("{} [{}{}] {}", name, std::string(full, '#'), std::string(width - full, ' '), end);
    const size_t rest = left - width;
    if (!note.empty() && rest > kLeastNote) line += " " + cutTo(note, rest - 1);
    return line;
}

} // namespace rolvane::cli
