#pragma once

#include <string>
#include <string_view>

namespace rolvane::davacl {

// The privileges of RFC 3744 section 3, as bits. DAV:unlock, the right to remove another's lock, is missing: mod_dav
// lets nobody but the holder of a lock give it back.
enum Privilege : unsigned {
    kRead = 1,
    kReadCurrentUserPrivilegeSet = 2,
    kWriteContent = 4,
    kWriteProperties = 8,
    kBind = 16,
    kUnbind = 32,
    kReadAcl = 64,
    kWriteAcl = 128
};

// What a list can grant. Everything else is abstract: it is part of these or the owner's alone.
inline constexpr unsigned kReading = kRead | kReadCurrentUserPrivilegeSet;
inline constexpr unsigned kWriting = kWriteContent | kWriteProperties | kBind | kUnbind;
inline constexpr unsigned kEverything = kReading | kWriting | kReadAcl | kWriteAcl;

// The element name of one bit.
const char* privilegeName(Privilege privilege);

enum class PrivilegeUse { concrete, abstract, unknown };
// Whether the element in DAV: names a privilege that an entry of a list may grant.
PrivilegeUse useOf(std::string_view name);

// DAV:privilege elements (section 5.4) for the bits, aggregates with their parts. The prefix D is DAV:.
std::string privilegeElements(unsigned privileges);
// The content of DAV:supported-privilege-set (section 5.3).
std::string supportedPrivileges();

} // namespace rolvane::davacl
