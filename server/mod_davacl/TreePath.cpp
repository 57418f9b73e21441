#include "server/mod_davacl/TreePath.h"

#include <algorithm>

namespace rolvane::davacl {
namespace {

constexpr size_t kLongestName = 200;

std::string lowered(std::string_view text) {
    std::string lower(text);
    for (char& c : lower)
        if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
    return lower;
}

bool isReservedSegment(std::string_view segment) {
    const std::string lower = lowered(segment);
    return lower.starts_with(".ht") || lower == ".dav";
}

} // namespace

std::optional<TreePath> TreePath::of(std::string_view base, std::string_view path) {
    if (!path.starts_with(base)) return std::nullopt;
    path.remove_prefix(base.size());
    if (!path.empty() && path.front() != '/') return std::nullopt;
    TreePath found;
    while (!path.empty()) {
        const size_t end = std::min(path.find('/'), path.size());
        if (const std::string_view segment = path.substr(0, end); !segment.empty()) {
            if (found.owner.empty())
                found.owner = segment;
            else
                found.below.emplace_back(segment);
        }
        path.remove_prefix(std::min(end + 1, path.size()));
    }
    return found;
}

std::string TreePath::tree(size_t count) const {
    std::string text;
    for (size_t i = 0; i < std::min(count, below.size()); ++i) text += (i ? "/" : "") + below[i];
    return text;
}

TreePath TreePath::parent() const {
    TreePath up = *this;
    if (up.below.empty())
        up.owner.clear();
    else
        up.below.pop_back();
    return up;
}

bool TreePath::isWithin(const TreePath& other) const {
    if (other.isBase()) return true;
    return owner == other.owner && below.size() >= other.below.size() &&
           std::equal(other.below.begin(), other.below.end(), below.begin());
}

bool TreePath::isReserved() const {
    return isReservedSegment(owner) || std::any_of(below.begin(), below.end(), isReservedSegment);
}

bool TreePath::isTooLong() const {
    constexpr size_t kLongestSegment = 255;
    const auto isLong = [](const std::string& segment) { return segment.size() > kLongestSegment; };
    return isLong(owner) || std::any_of(below.begin(), below.end(), isLong);
}

bool isAbove(std::string_view base, std::string_view path) {
    while (path.ends_with('/')) path.remove_suffix(1);
    return path.size() < base.size() && base.starts_with(path) && base[path.size()] == '/';
}

bool isUsableName(std::string_view name) {
    return !name.empty() && name.size() <= kLongestName && name != "." && name != ".." &&
           std::none_of(name.begin(), name.end(), [](unsigned char c) { return c == '/' || c < 0x20 || c == 0x7f; });
}

} // namespace rolvane::davacl
