#pragma once

#include "foundation/StrongString.h"

#include <cstdint>
#include <optional>
#include <string>

namespace rolvane {

// Conduit identifiers: keys of each conduit's data in the engine's conduit data.
inline constexpr const char* kConduitCX = "CXDCX";
inline constexpr const char* kConduitVaultra = "CXDVaultra";
inline constexpr const char* kConduitLocal = "CXDLocal";

// Pure mapping from a remote location's text to who serves it. "http://" and "file:/" are case-sensitive prefixes.
std::optional<std::string> conduitIDForRemoteLocation(const RemoteLocation& location);
int32_t syncSourceForRemoteLocation(const RemoteLocation& location); // a CXDSyncSource bit, or 0

// Whose data lives at a location, given the network account's user name and the login name. Nothing when no conduit
// serves the location; a location with too few path components belongs to nobody: the empty user.
std::optional<UserName> userForRemoteLocation(const RemoteLocation& location,
                                              const std::optional<UserName>& accountUser, const std::string& loginName);

} // namespace rolvane
