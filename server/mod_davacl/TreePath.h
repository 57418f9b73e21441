#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane::davacl {

// A place below the base, as httpd has decoded and cleaned its path. The first segment names the owner, to the letter.
struct TreePath {
    std::string owner;              // "" for the base itself
    std::vector<std::string> below; // the segments after the owner

    // Nothing when the path is neither the base nor below it.
    static std::optional<TreePath> of(std::string_view base, std::string_view path);

    bool isBase() const { return owner.empty(); }
    size_t levels() const { return isBase() ? 0 : below.size() + 1; }
    // The first `count` segments below the owner, joined by slashes.
    std::string tree(size_t count) const;
    std::string tree() const { return tree(below.size()); }
    TreePath parent() const;                    // the base is its own parent
    bool isWithin(const TreePath& other) const; // below it, or the same place
    // A segment that httpd or its file store keep for themselves (".htaccess" and the like, ".DAV"), in any case.
    bool isReserved() const;
    // A segment that no file system holds: it has more than 255 bytes.
    bool isTooLong() const;
};

// Whether the path is one of those on the way down to the base, "/" for instance; the base itself is none.
bool isAbove(std::string_view base, std::string_view path);

// Whether a name can stand in a file name and in a path segment: it holds no slash, control character or line break, is
// neither "." nor "..", and has at most 200 bytes.
bool isUsableName(std::string_view name);

} // namespace rolvane::davacl
