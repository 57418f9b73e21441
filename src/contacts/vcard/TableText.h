#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

// Address books that are no vCards: tables as RFC 4180 and spreadsheets write them, and LDIF (RFC 2849). Pure
// functions, any thread.

struct TableRow {
    size_t line = 0; // of its beginning, from 1
    std::vector<std::string> cells;
};

// The rows of a table; blank ones are left out. A quotation mark that nothing closes ends with the text. The separator
// is the comma, semicolon or tab that the first line has most of.
std::vector<TableRow> tableRows(std::string_view text);

struct LdifEntry {
    size_t line = 0; // of its "dn:"
    std::string dn;
    std::vector<std::pair<std::string, std::string>> attributes; // names in small letters, values decoded, in order
    std::string damaged;                                         // what of it could not be read, "" for nothing

    std::string first(std::string_view name) const; // "" for none
};

// The entries of an LDIF text; folded lines joined, base64 resolved.
std::vector<LdifEntry> ldifEntries(std::string_view text);

} // namespace rolvane
