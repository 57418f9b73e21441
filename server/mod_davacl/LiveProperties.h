#pragma once

#include "server/mod_davacl/Httpd.h"

#include <optional>
#include <string>
#include <string_view>

namespace rolvane::davacl {

// A property of our own: of a collection of files, its MembersTag. It is announced in the DAV header (RFC 4918 section
// 10.1), because on a server that does not know it anybody could set a property of that name.
inline constexpr const char* kMembersTagName = "members-tag";
inline constexpr const char* kMembersTagClass = "<http://rolvane.net/ns/members-tag>";
// That collections can be synchronised, so that nobody has to ask each for its reports.
inline constexpr const char* kSyncClass = "<http://rolvane.net/ns/sync-collection>";

// The properties of RFC 3744 section 5 on everything below the base. They are no part of "allprop".
extern const dav_liveprop_group kLiveProperties;
int findLiveProperty(const dav_resource* resource, const char* space, const char* name,
                     const dav_hooks_liveprop** hooks) noexcept;
void insertAllLiveProperties(request_rec* r, const dav_resource* resource, dav_prop_insert what,
                             apr_text_header* text) noexcept;

// The element of a property of RFC 3744 in DAV:, with its content; nothing when it is none of ours, not defined there
// or not for this user.
std::optional<std::string> livePropertyElement(const dav_resource* resource, std::string_view name);

// The directory that a collection of files is, below or at the one that the request names; nothing where none is
// served.
std::optional<std::string> directoryOf(request_rec* r, const dav_resource* resource);

// OPTIONS: "access-control" and the class above in the DAV header, ACL among the methods.
extern const dav_options_provider kOptions;

} // namespace rolvane::davacl
