#include "Table.h"

#include "foundation/CXException.h"

#include <ctime>
#include <fstream>
#include <iterator>

namespace rolvane::board {

namespace {

constexpr const char* kBegin = "<!-- the board -->\n";
constexpr const char* kEnd = "<!-- end of the board -->\n";
constexpr const char* kHead =
    "| row | fault | cases | failures | late | seeds | when |\n|---|---|---|---|---|---|---|\n";

std::string today() {
    const std::time_t now = std::time(nullptr);
    std::tm parts{};
    ::gmtime_r(&now, &parts);
    char text[32];
    const size_t length = std::strftime(text, sizeof text, "%Y-%m-%d %H:%M", &parts);
    return {text, length};
}

std::string lineOf(const TableRow& row) {
    std::string seeds;
    for (const uint64_t seed : row.seeds) seeds += (seeds.empty() ? "" : ", ") + std::to_string(seed);
    return "| " + row.name + " | " + row.fault + " | " + std::to_string(row.cases) + (row.part ? ", a part" : "") +
           " | " + std::to_string(row.failures) + " | " + std::to_string(row.late) + " | " + seeds + " | " + today() +
           " |\n";
}

} // namespace

std::string textOf(const std::vector<TableRow>& rows) {
    std::string text = kHead;
    for (const TableRow& row : rows) text += lineOf(row);
    return text;
}

void putInto(const std::string& path, const std::vector<TableRow>& rows) {
    std::ifstream in(path, std::ios::binary);
    std::string text{std::istreambuf_iterator<char>(in), {}};
    const size_t begin = text.find(kBegin), end = text.find(kEnd);
    if (begin == std::string::npos || end == std::string::npos)
        throw CXException("CXBoardException", path + " has no marks for the table");
    std::string table = text.substr(begin + std::string(kBegin).size(), end - begin - std::string(kBegin).size());
    if (table.empty()) table = kHead;
    for (const TableRow& row : rows) {
        const size_t former = table.find("| " + row.name + " |");
        if (former == std::string::npos)
            table += lineOf(row);
        else
            table.replace(former, table.find('\n', former) + 1 - former, lineOf(row));
    }
    text.replace(begin + std::string(kBegin).size(), end - begin - std::string(kBegin).size(), table);
    std::ofstream(path, std::ios::binary | std::ios::trunc) << text;
}

} // namespace rolvane::board
