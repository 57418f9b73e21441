#pragma once

#include "foundation/SharedText.h"

#include <compare>
#include <functional>
#include <string>
#include <string_view>
#include <utility>

namespace rolvane {

// A string with a meaning of its own: two different ones cannot be swapped, compared or assigned by accident.
// Immutable; copies share the text, also with the Value that is made of one.
template <class Tag>
class StrongString {
public:
    StrongString() = default;
    explicit StrongString(std::string s) : _s(std::move(s)) {}
    explicit StrongString(std::string_view s) : _s(std::string(s)) {}
    explicit StrongString(const char* s) : _s(std::string(s)) {}
    explicit StrongString(SharedText s) : _s(std::move(s)) {}

    const std::string& str() const { return _s.str(); }
    const SharedText& text() const { return _s; }
    const char* c_str() const { return str().c_str(); }
    bool empty() const { return _s.empty(); }
    bool endsWith(std::string_view suffix) const { return std::string_view(str()).ends_with(suffix); }

    friend std::strong_ordering operator<=>(const StrongString&, const StrongString&) = default;
    friend bool operator==(const StrongString&, const StrongString&) = default;
    friend const std::string& description(const StrongString& s) { return s.str(); }

private:
    SharedText _s;
};

// Whose data something is: an account name, or the owner marker "<self>".
using UserName = StrongString<struct UserNameTag>;
// A record identifier, "<UUID>:<table>" or "AllCXGroup".
using UniqueId = StrongString<struct UniqueIdTag>;
// Where a publication or subscription lives: a URL's text, or the word "local".
using RemoteLocation = StrongString<struct RemoteLocationTag>;
// An HTTP entity tag with its quotes (RFC 9110, section 8.8.3).
using EntityTag = StrongString<struct EntityTagTag>;
// A WebDAV lock token URI (RFC 4918, section 6.5).
using LockToken = StrongString<struct LockTokenTag>;

inline const UserName kSelf{"<self>"};

} // namespace rolvane

template <class Tag>
struct std::hash<rolvane::StrongString<Tag>> {
    size_t operator()(const rolvane::StrongString<Tag>& s) const noexcept { return s.text().hash(); }
};
