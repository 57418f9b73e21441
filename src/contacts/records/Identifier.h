#pragma once

#include "foundation/StrongString.h"

#include <string_view>

namespace rolvane {

// Identifiers of records: "<UUID>:<table>", or "AllCXGroup" for the all-contacts group of this database, which has no
// UUID because every database has exactly one. The all-contacts group of a subscribed location is
// "<UUID>:AllCXSubscribedGroup". Pure string functions; nothing here looks at a database.

inline constexpr std::string_view kCXPersonTable = "CXPerson";
inline constexpr std::string_view kCXSubscribedPersonTable = "CXSubscribedPerson";
inline constexpr std::string_view kCXGroupTable = "CXGroup";
inline constexpr std::string_view kCXSubscribedGroupTable = "CXSubscribedGroup";
inline constexpr std::string_view kCXSubscriptionTable = "CXSubscriptionRecord";
inline constexpr std::string_view kCXGroupContentsTable = "CXGroupContents";
inline constexpr std::string_view kCXSubscribedGroupContentsTable = "CXSubscribedGroupContents";
inline constexpr std::string_view kCXInfoTable = "CXInfo";
inline constexpr std::string_view kCXAllGroupUID = "AllCXGroup";
inline constexpr std::string_view kCXAllSubscribedGroupTable = "AllCXSubscribedGroup";

// The identifier with its table replaced. An all-contacts group keeps its "All": "AllCXGroup" for "CXSubscribedGroup"
// is "AllCXSubscribedGroup", and back; the same behind a UUID. An identifier without a table gets the table appended.
UniqueId cxUIDWithTableName(const UniqueId& uid, std::string_view table);

// The identifier as it is shared: people "CXPerson", groups "CXGroup", subscribed or not. "AllCXGroup" stays; other
// tables stay. Idempotent.
UniqueId cxNormalizedUID(const UniqueId& uid);

// True when the identifier names a subscribed person or group.
bool cxIsSubscribed(const UniqueId& uid);

// The part behind the last colon ("AllCXGroup" whole), and the part before it ("" for "AllCXGroup").
std::string_view cxTableName(const UniqueId& uid);
std::string_view cxUUIDPart(const UniqueId& uid);

// A fresh identifier for the table.
UniqueId makeUniqueId(std::string_view table);

} // namespace rolvane
