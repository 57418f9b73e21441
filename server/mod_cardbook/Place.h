#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace rolvane::cardbook {

// Where a path leads below the module's base:
//   BASE/                     whence a client finds the rest
//   BASE/principal/           who is signed in
//   BASE/home/                the books
//   BASE/home/BOOK/           "contacts", "group-<UUID>" or "shared-<UUID of the subscription>"
//   BASE/home/BOOK/NAME       a card
// Pure; paths are decoded ones.
struct Place {
    enum class Kind { root, principal, home, book, card, nowhere };
    Kind kind = Kind::nowhere;
    std::string book, name;

    friend bool operator==(const Place&, const Place&) = default;
};

inline constexpr std::string_view kContactsBook = "contacts";
inline constexpr std::string_view kGroupBook = "group-";
inline constexpr std::string_view kSharedBook = "shared-";

// `base` is without a slash at its end. Nothing when the path is not below it.
std::optional<Place> placeOf(std::string_view base, std::string_view path);
// The path of a place that is somewhere, with a slash at the end of a collection's.
std::string pathOf(std::string_view base, const Place& place);
// A path in the form that it has in an href (RFC 3986 section 3.3).
std::string escapedPath(std::string_view path);
// The decoded path of an href, which is a path or a whole URL (RFC 4918 section 8.3); nothing when it is neither.
std::optional<std::string> pathOfHref(std::string_view href);
// May a card be called so? Not "", ".", ".." and what a path cannot say.
bool isUsableName(std::string_view name);

} // namespace rolvane::cardbook
