#pragma once

#include <string>

namespace rolvane {

// Copies an SQLite file that other processes may be writing: what had been saved at one moment, its log included. The
// copy is a single file of mode 0600 without a log beside it, on the disk when this returns, and SQLite finds nothing
// wrong in it. `to` must not exist. CXException (kCXDatabaseException) tells what failed and removes the copy; a file
// that is damaged is a CXDamagedDatabase. Any thread.
void copyDatabase(const std::string& from, const std::string& to);

} // namespace rolvane
