#pragma once

#include "foundation/Sqlite.h"

#include <string>

namespace rolvane {

// A failure of SQLite as a CXException kCXDatabaseException that speaks of the contact database; a damaged file is a
// CXDamagedDatabase.
[[noreturn]] void throwDatabaseError(const std::string& path, const SqliteFailure& failure);

} // namespace rolvane
