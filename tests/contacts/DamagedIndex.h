#pragma once

#include "foundation/Sqlite.h"

#include <gtest/gtest.h>
#include <string>

namespace rolvane::test {

// Changes the tables of a database file and not that index, as a damaged b-tree would stand: the schema does not know
// of the index meanwhile, so that the change does not reach it. Nobody has the file open.
inline void changeWithout(const std::string& path, const std::string& index, const std::string& change) {
    Sqlite file(path, 1000);
    const std::string ofIndex = " FROM sqlite_schema WHERE name='" + index + "'";
    const int64_t root = file.integer("SELECT rootpage" + ofIndex);
    ASSERT_GT(root, 0) << "there is no such index";
    file.execute("PRAGMA writable_schema=ON; CREATE TABLE kept AS SELECT *" + ofIndex + "; DELETE" + ofIndex +
                 "; PRAGMA writable_schema=RESET;");
    file.execute(change);
    file.execute("PRAGMA writable_schema=ON; INSERT INTO sqlite_schema SELECT * FROM kept; DROP TABLE kept; "
                 "PRAGMA writable_schema=RESET;");
    ASSERT_EQ(file.integer("SELECT rootpage" + ofIndex), root);
}

// A contact that the table has and the index of a location's records does not find.
inline void loseInTheIndex(const std::string& path, const std::string& uid) {
    Sqlite(path, 1000).execute("UPDATE records SET kind=9 WHERE uid='" + uid + "'"); // in the table and all indexes
    changeWithout(path, "records_location", "UPDATE records SET kind=1 WHERE uid='" + uid + "'");
}

} // namespace rolvane::test
