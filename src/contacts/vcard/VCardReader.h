#pragma once

#include "contacts/vcard/VCardScanner.h"
#include "foundation/Value.h"

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

// Which of a member's values a group uses: an entry of the member's multi-value property, named by its label and its
// text, because identifiers of entries belong to one database.
struct VCardChoice {
    std::string member;   // UID text
    std::string property; // kCXEmailProperty
    std::string label;
    std::string raw; // as vcardEncodeMultiValue writes the value

    friend bool operator==(const VCardChoice&, const VCardChoice&) = default;
};

// What a card says. For a person `properties` are those of CXPerson, multi-values in their Value form with fresh
// identifiers; names of CATEGORIES are in `categories`, not among the properties. For a group they are those of
// CXGroup, and the four lists say who is in it.
//
// What the dictionary has no place for is kept under kCXVCardExtraProperty, sorted:
// - a content line, unfolded and in the form of vcardKeptForm, is written again as it stands ("X-COLOUR:red", "UID:…"
// of a card whose UID is no UUID).
//   Where it would be taken for something else, because the property that it stood behind is gone, it is written as the
//   text of an X-ROLVANE-KEPT, from which reading takes it out again ("X-ROLVANE-KEPT:NICKNAME:Jack");
// - a content line behind "+" carries parameters and the group of a line that the dictionary does express
//   ("+TEL;TYPE=car;PREF=1;X-ROLVANE-LABEL=Car:+44 1"); it is used as long as that value and label are there. The value
//   is the one that is written (a PHOTO's: vcardEncodeSingle); parts behind those of an ADR or N are its parameter
//   X-ROLVANE-REST, and an N whose parts are lists is its parameter X-ROLVANE-RAW. Of CATEGORIES the names that are
//   still there keep it, of a MEMBER whoever vcardMemberKey means, a group in the group among them.
struct VCardEntity {
    bool isGroup = false;
    std::string uid; // UID text as in the card, "" for none
    Dictionary properties;
    std::vector<std::string> categories;
    std::vector<std::string> members, subgroups; // UID texts
    std::vector<VCardChoice> choices;
    size_t line = 0;                  // of the card's beginning
    std::vector<VCardNotice> notices; // lines of the card that were not read
};

// Reads a scanned card. A line with a damaged value is kept as it stands, and said. Nothing when the card is a bad one;
// `error` then has line and reason. Pure; any thread.
std::optional<VCardEntity> vcardEntityFromCard(const VCard& card, VCardError& error);

// Lines that the database keeps for the import and export to come, and that no card has: a member of a group who has no
// card here, a person's categories in the order of the card, and the UID of a card that was joined with another one.
inline constexpr const char* kVCardMissingMemberLine = "X-ROLVANE-MISSING";
inline constexpr const char* kVCardCategoryOrderLine = "X-ROLVANE-CATEGORY-ORDER";
inline constexpr const char* kVCardJoinedUIDLine = "X-ROLVANE-JOINED";
// The kept lines of a name among the properties.
std::vector<VCardLine> vcardKeptLines(const Dictionary& properties, std::string_view name);
// The properties with these lines instead of all of that name.
void vcardReplaceKeptLines(Dictionary& properties, std::string_view name, const std::vector<VCardLine>& lines);

// Whoever a UID text means, however it is spelt.
std::string vcardMemberKey(std::string_view uid);

// The UID text of a record identifier ("urn:uuid:<UUID>") and the UUID part of the record for a UID text.
std::string vcardUIDForUUID(std::string_view uuid);

} // namespace rolvane
