#include "server/mod_cardbook/CardWriter.h"
#include "support/TempHome.h"

#include <atomic>
#include <gtest/gtest.h>
#include <sqlite3.h>

// What a write costs, counted in rows that SQLite hands out.

namespace rolvane {
namespace {

using namespace cardbook;

std::atomic<int64_t> rowsRead = 0;

int countRow(unsigned, void*, void*, void*) {
    ++rowsRead;
    return 0;
}

int traceConnection(sqlite3* handle, char**, const void*) {
    return sqlite3_trace_v2(handle, SQLITE_TRACE_ROW, countRow, nullptr);
}

// Connections that are opened while it lives are counted.
class CountedRows {
public:
    CountedRows() { sqlite3_auto_extension(entry()); }
    ~CountedRows() { sqlite3_cancel_auto_extension(entry()); }
    CountedRows(const CountedRows&) = delete;
    CountedRows& operator=(const CountedRows&) = delete;

private:
    using Entry = void (*)();
    static Entry entry() { return reinterpret_cast<Entry>(traceConnection); }
};

struct Costs {
    int64_t ofNobodyExpected = 0, ofTheExpected = 0;
    size_t joined = 0;
};

// Of two new cards beside so many groups that wait for others, and one that waits for the second.
Costs costsBeside(int groups) {
    const CountedRows counted;
    const test::TempDirectory directory;
    Library library(directory / "contacts.db");
    const auto put = [&](const std::string& name, const std::string& lines) {
        library.catchUp();
        const Book book = *library.book(std::string(kContactsBook));
        const int64_t before = rowsRead;
        CardWriter(library, {book, name + ".vcf", "/books", "laptop", {}, {}})
            .put("BEGIN:VCARD\r\nVERSION:4.0\r\nUID:" + name + "\r\nFN:" + name + "\r\n" + lines + "END:VCARD\r\n");
        return rowsRead - before;
    };
    for (int i = 0; i < groups; ++i)
        put("group" + std::to_string(i), "KIND:group\r\nMEMBER:late" + std::to_string(i) + "\r\n");
    put("friends", "KIND:group\r\nMEMBER:ann\r\n");
    Costs costs;
    costs.ofNobodyExpected = put("bob", "");
    costs.ofTheExpected = put("ann", "");
    for (const CXListing& line : library.rolvane().listGroups(RemoteLocation("")))
        costs.joined +=
            std::dynamic_pointer_cast<CXGroup>(library.rolvane().recordForUniqueId(line.uniqueId))->memberCount();
    return costs;
}

TEST(Costs, OfANewCardAreThoseOfTheGroupsThatWaitForIt) {
    const Costs few = costsBeside(3), many = costsBeside(60);
    EXPECT_GT(few.ofNobodyExpected, 0);
    EXPECT_EQ(many.ofNobodyExpected, few.ofNobodyExpected);
    EXPECT_EQ(many.ofTheExpected, few.ofTheExpected);
    EXPECT_EQ(few.joined, 1u);
    EXPECT_EQ(many.joined, 1u);
}

} // namespace
} // namespace rolvane
