#pragma once

#include "foundation/StrongString.h"
#include "foundation/Url.h"
#include "foundation/Value.h"

#include <string>
#include <string_view>

// What lies on a published store: pure functions from names and values to names and values. A tree looks like this,
// below one base location per user:
//
//   People/<0..31>/<person>   one contact, the bucket chosen by the person's identifier
//   <group>                   a group's state: members, subgroups, name, distribution lists
//   <group>/info              a group's information dictionary (the same path is a file and a directory)
//   <group>/<person>          a member's marker
//   info, dateFile            the tree's own information; the clock file, which is also what is locked
//   computers                 which computers of its owner keep the tree in step, see store/ComputersOnStore.h
//
// Every dictionary file is an XML property list.
namespace rolvane::layout {

inline constexpr std::string_view kPeople = "People";
inline constexpr std::string_view kInfo = "info";
inline constexpr std::string_view kDateFile = "dateFile";
inline constexpr std::string_view kContacts = "Contacts";
inline constexpr std::string_view kAllGroup = "AllCXGroup";
inline constexpr std::string_view kMemberMarkerText = "Distribution Lists Go Here";
inline constexpr std::string_view kClockText = "why";

Url contactLocation(const Url& base, const UniqueId& person);
Url groupLocation(const Url& base, const UniqueId& group); // state file and directory
Url groupInfoLocation(const Url& base, const UniqueId& group);
Url memberMarkerLocation(const Url& base, const UniqueId& group, const UniqueId& person);
Url dateFileLocation(const Url& base);

// Bookkeeping files, never contacts or groups: exactly "dateFile", "info" or "Contacts".
bool isASpecialFile(std::string_view name);

// Whether a group or person may be called so in a tree: no name of the tree's own files and folders.
bool isARecordsName(const UniqueId& uid);

// Whether a name in a listing can be a record's: valid UTF-8 of at most 255 bytes without control characters or
// slashes, not the name of a hidden file.
bool isASoundName(std::string_view name);

inline constexpr uint64_t kLargestFile = 64u << 20; // bytes; as much of an answer as is ever read

// The group state after a composite change; `state` and `payload` stay as they are. Additions come before removals, a
// member is listed once however often it is added, a removal takes out every occurrence, and the three containers
// exist afterwards. A part of either that is of another kind than expected counts as empty.
Dictionary groupStateAfterComposite(const Dictionary& state, const Dictionary& payload);

// The "info" dictionary that a rename writes on the network store: the name and nothing else.
Dictionary infoAfterRename(const Value& name);

} // namespace rolvane::layout
