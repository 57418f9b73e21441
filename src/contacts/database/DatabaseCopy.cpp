#include "contacts/database/DatabaseCopy.h"

#include "contacts/database/DamagedDatabase.h"
#include "contacts/database/DatabaseErrors.h"
#include "foundation/Sqlite.h"

#include <filesystem>
#include <memory>
#include <sqlite3.h>

namespace rolvane {

namespace {

constexpr int kBusyTimeoutMilliseconds = 10000;

using Handle = std::unique_ptr<sqlite3, int (*)(sqlite3*)>;

Handle opened(const std::string& path, int flags) {
    sqlite3* raw = nullptr;
    const int code = sqlite3_open_v2(path.c_str(), &raw, flags | SQLITE_OPEN_NOMUTEX, nullptr);
    Handle handle(raw, sqlite3_close_v2);
    if (code != SQLITE_OK) throwDatabaseError(path, SqliteFailure::of(raw, code, "open"));
    sqlite3_extended_result_codes(raw, 1);
    sqlite3_busy_timeout(raw, kBusyTimeoutMilliseconds);
    return handle;
}

void copyPages(sqlite3* from, const std::string& fromPath, sqlite3* to, const std::string& toPath) {
    sqlite3_backup* backup = sqlite3_backup_init(to, "main", from, "main");
    if (!backup) throwDatabaseError(toPath, SqliteFailure::of(to, sqlite3_errcode(to), "write"));
    const int stepped = sqlite3_backup_step(backup, -1); // all of it, of one moment
    const int finished = sqlite3_backup_finish(backup);
    const int code = stepped == SQLITE_DONE ? finished : stepped;
    // Which of the two files it was stands in neither answer. A full disk is the copy's, damage the original's.
    if (code != SQLITE_OK)
        throwDatabaseError((code & 0xff) == SQLITE_FULL ? toPath : fromPath, SqliteFailure::of(nullptr, code, "copy"));
}

void requireWhole(const std::string& copy, const std::string& original) {
    Sqlite database(copy, kBusyTimeoutMilliseconds, throwDatabaseError);
    database.execute("PRAGMA journal_mode=DELETE"); // a single file
    auto check = database.statement("PRAGMA integrity_check(1)");
    const std::string found = check.step() ? check.text(0) : "no answer";
    if (found != "ok") throw CXDamagedDatabase("The file " + original + " is damaged (" + found + ").");
}

} // namespace

void copyDatabase(const std::string& from, const std::string& to) {
    try {
        // Makes the file with its mode.
        const Sqlite made(to, kBusyTimeoutMilliseconds, throwDatabaseError);
        const Handle source = opened(from, SQLITE_OPEN_READWRITE);
        const Handle copy = opened(to, SQLITE_OPEN_READWRITE);
        copyPages(source.get(), from, copy.get(), to);
    } catch (const CXException&) {
        std::error_code ignored;
        std::filesystem::remove(to, ignored);
        throw;
    }
    try {
        requireWhole(to, from);
    } catch (const CXException&) {
        std::error_code ignored;
        for (const char* suffix : {"", "-wal", "-shm", "-journal"}) std::filesystem::remove(to + suffix, ignored);
        throw;
    }
}

} // namespace rolvane
