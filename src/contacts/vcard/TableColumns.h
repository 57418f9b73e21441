#pragma once

#include <optional>
#include <string>
#include <vector>

namespace rolvane {

// What a column of a table of people says. Pure functions, any thread.
enum class ColumnKind {
    unknown,
    text,        // `property`, a single text
    entry,       // a value of the multi-value `property` under `label`
    addressPart, // `key` of the address of number `group` under `label`
    entryValue,  // the value of the entry of number `group` of `property`, whose label may stand in another column
    entryLabel,  // that label
    note,
    date,      // `property`, a date
    dateEntry, // a date of the multi-value `property` under `label`
    birthYear,
    birthMonth,
    birthDay,
    categories,
    company,    // true for an organisation
    saysNothing // of the export, or said elsewhere
};

struct Column {
    ColumnKind kind = ColumnKind::unknown;
    std::string property, label, key;
    int group = 0; // entries with two columns, and addresses, by number
};

// By its header, letter case aside.
Column columnOf(const std::string& header);

// A header of an address book: has a name or a mail address, and mostly columns that are known.
bool isHeaderOfPeople(const std::vector<std::string>& header);

// The label that a cell means: "* Work", "Home Fax", "mobile".
std::string labelOfCell(const std::string& cell);

} // namespace rolvane
