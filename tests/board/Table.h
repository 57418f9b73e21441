#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace rolvane::board {

struct TableRow {
    std::string name, fault;
    size_t cases = 0, failures = 0, late = 0;
    std::vector<uint64_t> seeds;
    bool part = false; // not every case was made
};

// As Markdown, with today's date.
std::string textOf(const std::vector<TableRow>& rows);

// Puts the rows into the table of the file, between its marks: a row of the same name is replaced, others stay.
// Throws CXException when the file has no marks.
void putInto(const std::string& path, const std::vector<TableRow>& rows);

} // namespace rolvane::board
