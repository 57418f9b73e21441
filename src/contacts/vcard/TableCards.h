#pragma once

#include "contacts/vcard/VCardReader.h"

#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

// The address books that other programs export as tables (Google, Outlook, Thunderbird) or as LDIF (Thunderbird), as
// what cards would say. Recognised by their header; a column or attribute that people have no place for goes into the
// note, "Column: value". Pure functions, any thread.
struct TableCards {
    std::vector<VCardEntity> cards;       // a group of LDIF names its members by the `uid` of theirs
    std::vector<std::string> intoTheNote; // columns or attributes, each once
    std::vector<VCardNotice> notices;     // what could not be read, or may be meant otherwise
    bool namesItself = false;             // the uids are the addresses of entries within this text, and no UIDs
};

enum class TableKind { none, table, ldif };
TableKind tableKindOf(std::string_view start); // of the first 8 KB of a text

TableCards cardsOfTable(std::string_view text); // UTF-8
TableCards cardsOfLdif(std::string_view text);

} // namespace rolvane
