#pragma once

#include "contacts/records/Identifier.h"
#include "foundation/Value.h"

#include <string>
#include <string_view>

namespace rolvane {

// What a row is; the numbers stand in the file.
enum class RecordKind : int {
    none = 0,
    person = 1,
    subscribedPerson = 2,
    group = 3,
    subscribedGroup = 4,
    allGroup = 5,
    allSubscribedGroup = 6,
    subscription = 7,
    groupContents = 100, // never a row
    info = 101,          // never a row
};

constexpr bool isPerson(RecordKind k) {
    return k == RecordKind::person || k == RecordKind::subscribedPerson;
}
constexpr bool isPlainGroup(RecordKind k) {
    return k == RecordKind::group || k == RecordKind::subscribedGroup;
}
constexpr bool isAllKind(RecordKind k) {
    return k == RecordKind::allGroup || k == RecordKind::allSubscribedGroup;
}
constexpr bool isGroup(RecordKind k) {
    return isPlainGroup(k) || isAllKind(k);
}

RecordKind kindOfTable(std::string_view table); // none when it is no table of records
std::string_view tableOfKind(RecordKind kind);

// What is kept beside the properties of a row, made from them.
struct DerivedColumns {
    std::string location; // "" for the owner's own
    std::string display, sort, search;
};
DerivedColumns deriveColumns(RecordKind kind, const Dictionary& properties);
std::string locationOf(RecordKind kind, const Dictionary& properties);
std::string foldCase(std::string_view utf8); // letter case only, any script; malformed bytes stay

// "All Contacts" and "untitled group" in the user's language.
std::string defaultGroupName(RecordKind kind);

} // namespace rolvane
