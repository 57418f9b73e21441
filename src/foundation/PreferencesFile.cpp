#include "foundation/PreferencesFile.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"

#include <cerrno>
#include <climits>
#include <cstring>

#include <fcntl.h>
#include <fmt/format.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

namespace rolvane {

namespace {

constexpr int64_t kApplicationID = 0x524b5046; // "RKPF"
constexpr int64_t kFormatVersion = 1;

std::string directoryOf(const std::string& path) {
    size_t slash = path.rfind('/');
    if (slash == std::string::npos) return ".";
    return slash == 0 ? "/" : path.substr(0, slash);
}

bool exists(const std::string& path) {
    struct stat st;
    return ::stat(path.c_str(), &st) == 0;
}

bool noRoom(int code, int systemError) {
    return (code & 0xff) == SQLITE_FULL || systemError == ENOSPC || systemError == EDQUOT || systemError == EFBIG;
}

// A reader of a read-only file leaves the journal's files read-only beside it. When the file has become writable again,
// so must they, else the file would seem to be read-only for ever.
void giveJournalTheRightsOf(const std::string& path) {
    if (::access(path.c_str(), W_OK) != 0) return;
    for (const char* suffix : {"-wal", "-shm"})
        if (std::string journal = path + suffix; exists(journal) && ::access(journal.c_str(), W_OK) != 0)
            ::chmod(journal.c_str(), 0600);
}

constexpr const char* kKept = "Nothing was lost: the changes are kept in memory and written with the next attempt.";

// What happened to which file, and what to do: one sentence a kind of failure.
std::string explain(const std::string& path, int code, int systemError, const std::string& detail) {
    if (noRoom(code, systemError))
        return fmt::format("There is no room to write the preferences file \"{}\" ({}). Make room on its file system, "
                           "then try again. {}",
                           path, detail, kKept);
    switch (code & 0xff) {
    case SQLITE_CORRUPT:
    case SQLITE_NOTADB:
    case SQLITE_FORMAT:
        return fmt::format(
            "The preferences file \"{0}\" is damaged ({1}). It was left as it is. Restore it from a backup, "
            "or move it away (mv '{0}' '{0}.damaged') to start with empty preferences.",
            path, detail);
    case SQLITE_BUSY:
    case SQLITE_LOCKED:
    case SQLITE_PROTOCOL:
        return fmt::format(
            "The preferences file \"{}\" is locked by another program ({}). Close that program or wait for "
            "it, then try again. {}",
            path, detail, kKept);
    case SQLITE_READONLY:
    case SQLITE_PERM:
    case SQLITE_AUTH:
        return fmt::format(
            "The preferences file \"{0}\" cannot be written: it is read-only ({1}). Give yourself the right "
            "to write it and its directory (chmod u+rw '{0}'), then try again. {2}",
            path, detail, kKept);
    case SQLITE_CANTOPEN:
        return fmt::format(
            "The preferences file \"{}\" cannot be opened ({}{}{}). Check that it and its directory exist and "
            "belong to you, then try again.",
            path, detail, systemError ? ": " : "", systemError ? std::strerror(systemError) : "");
    default:
        return fmt::format(
            "The preferences file \"{}\" cannot be used ({}{}{}). Check that there is room on its file system "
            "and that the disk is sound, then try again. {}",
            path, detail, systemError ? ": " : "", systemError ? std::strerror(systemError) : "", kKept);
    }
}

[[noreturn]] void failWith(std::string reason) {
    throw CXException(kCXPreferencesException, std::move(reason));
}

} // namespace

void PreferencesFile::StatementCloser::operator()(sqlite3_stmt* statement) const {
    sqlite3_finalize(statement);
}

PreferencesFile::PreferencesFile(std::string path, double lockTimeoutSeconds)
    : _path(std::move(path)), _lockTimeout(lockTimeoutSeconds) {}

PreferencesFile::~PreferencesFile() {
    close();
}

void PreferencesFile::fail(int code) const {
    if (!_db) failWith(explain(_path, code, 0, sqlite3_errstr(code)));
    int extended = sqlite3_extended_errcode(_db);
    bool current = (extended & 0xff) == (code & 0xff);
    int systemError = current ? sqlite3_system_errno(_db) : 0;
    failWith(explain(_path, code, systemError, current ? sqlite3_errmsg(_db) : sqlite3_errstr(code)));
}

bool PreferencesFile::hasMoved() const {
    int moved = 0;
    if (sqlite3_file_control(_db, "main", SQLITE_FCNTL_HAS_MOVED, &moved) != SQLITE_OK) return false;
    return moved != 0;
}

void PreferencesFile::close() {
    if (!_db) return;
    // The journal's path may already belong to a successor of this file; it must not be taken away from it.
    if (hasMoved()) sqlite3_db_config(_db, SQLITE_DBCONFIG_NO_CKPT_ON_CLOSE, 1, nullptr);
    sqlite3_close_v2(_db);
    _db = nullptr;
    _tableSeen = false;
}

void PreferencesFile::open() {
    giveJournalTheRightsOf(_path);
    int code = sqlite3_open_v2(_path.c_str(), &_db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr);
    try {
        if (code != SQLITE_OK) fail(code);
        sqlite3_extended_result_codes(_db, 1);
        sqlite3_busy_timeout(_db, static_cast<int>(_lockTimeout * 1000));
        sqlite3_db_config(_db, SQLITE_DBCONFIG_DEFENSIVE, 1, nullptr);
        sqlite3_db_config(_db, SQLITE_DBCONFIG_TRUSTED_SCHEMA, 0, nullptr);
        checkFormat();
        execute("PRAGMA synchronous=FULL");
        execute("PRAGMA journal_size_limit=4194304");
    } catch (...) {
        close();
        throw;
    }
}

void PreferencesFile::checkFormat() {
    execute("BEGIN"); // one view of the file: another process may be making it now
    int64_t tables = number("SELECT count(*) FROM sqlite_master");
    int64_t application = number("PRAGMA application_id"), version = number("PRAGMA user_version");
    execute("COMMIT");
    if (tables == 0) return; // new, or cut off before its first transaction
    if (application != kApplicationID)
        failWith(
            fmt::format("\"{}\" is not a preferences file but some other database. It was left as it is. Move it away, "
                        "then try again.",
                        _path));
    if (version > kFormatVersion)
        failWith(fmt::format(
            "The preferences file \"{}\" was written by a newer version (format {}, this program knows {}). "
            "It was left as it is. Update this program.",
            _path, version, kFormatVersion));
}

bool PreferencesFile::openExisting() {
    if (_db && hasMoved()) close();
    if (!_db) {
        if (!exists(_path)) {
            if (errno == ENOENT || errno == ENOTDIR) return false;
            failWith(explain(_path, SQLITE_CANTOPEN, errno, "no access"));
        }
        open();
    }
    return hasTable();
}

void PreferencesFile::createFile() {
    CXPathUtils_MakeCompletePath(directoryOf(_path), 0700);
    int fd = ::open(_path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
    if (fd < 0) {
        if (errno == EEXIST) return; // another process was faster
        failWith(explain(_path, errno == EROFS || errno == EACCES ? SQLITE_READONLY : SQLITE_CANTOPEN, errno,
                         std::strerror(errno)));
    }
    ::fchmod(fd, 0600); // whatever the umask
    ::close(fd);
}

void PreferencesFile::openOrCreate() {
    if (openExisting()) return;
    if (!_db) {
        createFile();
        open();
    }
    // Refused on a file system without shared memory and while another process makes the file: the rollback journal
    // serves as well.
    sqlite3_exec(_db, "PRAGMA journal_mode=WAL", nullptr, nullptr, nullptr);
}

bool PreferencesFile::hasTable() {
    if (!_tableSeen) _tableSeen = number("SELECT count(*) FROM sqlite_master WHERE name = 'preferences'") != 0;
    return _tableSeen;
}

int64_t PreferencesFile::number(const char* sql) {
    auto statement = prepare(sql);
    return step(statement.get()) ? sqlite3_column_int64(statement.get(), 0) : 0;
}

void PreferencesFile::execute(const char* sql) {
    if (int code = sqlite3_exec(_db, sql, nullptr, nullptr, nullptr); code != SQLITE_OK) fail(code);
}

PreferencesFile::Statement PreferencesFile::prepare(const char* sql) {
    sqlite3_stmt* statement = nullptr;
    int code = sqlite3_prepare_v2(_db, sql, -1, &statement, nullptr);
    if (code != SQLITE_OK) fail(code);
    return Statement(statement);
}

bool PreferencesFile::step(sqlite3_stmt* statement) {
    int code = sqlite3_step(statement);
    if (code == SQLITE_ROW) return true;
    if (code != SQLITE_DONE) fail(code);
    return false;
}

void PreferencesFile::bindText(sqlite3_stmt* statement, int index, std::string_view text) {
    int code =
        sqlite3_bind_text64(statement, index, text.data() ? text.data() : "", text.size(), SQLITE_STATIC, SQLITE_UTF8);
    if (code != SQLITE_OK) fail(code);
}

std::optional<Bytes> PreferencesFile::read(std::string_view domain, std::string_view key) {
    if (!openExisting()) return {};
    auto statement = prepare("SELECT rowid, length(value) FROM preferences WHERE domain = ?1 AND key = ?2");
    bindText(statement.get(), 1, domain);
    bindText(statement.get(), 2, key);
    if (!step(statement.get())) return {};
    // Straight into place: as a column, a large value would stand in memory twice. The open statement keeps the view.
    Bytes bytes(static_cast<size_t>(sqlite3_column_int64(statement.get(), 1)));
    sqlite3_blob* blob = nullptr;
    int code =
        sqlite3_blob_open(_db, "main", "preferences", "value", sqlite3_column_int64(statement.get(), 0), 0, &blob);
    if (code == SQLITE_OK && sqlite3_blob_bytes(blob) != static_cast<int>(bytes.size())) code = SQLITE_CORRUPT;
    if (code == SQLITE_OK) code = sqlite3_blob_read(blob, bytes.data(), static_cast<int>(bytes.size()), 0);
    if (code != SQLITE_OK) {
        sqlite3_blob_close(blob);
        fail(code);
    }
    sqlite3_blob_close(blob);
    return bytes;
}

std::vector<std::string> PreferencesFile::strings(const char* sql, std::optional<std::string_view> argument) {
    if (!openExisting()) return {};
    auto statement = prepare(sql);
    if (argument) bindText(statement.get(), 1, *argument);
    std::vector<std::string> out;
    while (step(statement.get())) {
        auto* text = reinterpret_cast<const char*>(sqlite3_column_text(statement.get(), 0));
        out.emplace_back(text ? text : "", static_cast<size_t>(sqlite3_column_bytes(statement.get(), 0)));
    }
    return out;
}

std::vector<std::string> PreferencesFile::keys(std::string_view domain) {
    return strings("SELECT key FROM preferences WHERE domain = ?1 ORDER BY key", domain);
}

std::vector<std::string> PreferencesFile::domains() {
    return strings("SELECT DISTINCT domain FROM preferences ORDER BY domain", {});
}

void PreferencesFile::write(std::string_view domain, const Changes& changes) {
    openOrCreate();
    execute("BEGIN IMMEDIATE");
    try {
        if (!hasTable()) {
            execute("CREATE TABLE preferences (domain TEXT NOT NULL, key TEXT NOT NULL, value BLOB NOT NULL, "
                    "PRIMARY KEY (domain, key)) STRICT");
            execute(fmt::format("PRAGMA application_id={}", kApplicationID).c_str());
            execute(fmt::format("PRAGMA user_version={}", kFormatVersion).c_str());
        }
        applyChanges(domain, changes);
        execute("COMMIT");
    } catch (...) {
        rollBack();
        throw;
    }
}

void PreferencesFile::rollBack() noexcept {
    _tableSeen = false;
    if (!sqlite3_get_autocommit(_db)) sqlite3_exec(_db, "ROLLBACK", nullptr, nullptr, nullptr);
}

void PreferencesFile::applyChanges(std::string_view domain, const Changes& changes) {
    auto put = prepare("INSERT INTO preferences (domain, key, value) VALUES (?1, ?2, ?3) "
                       "ON CONFLICT (domain, key) DO UPDATE SET value = excluded.value");
    auto erase = prepare("DELETE FROM preferences WHERE domain = ?1 AND key = ?2");
    for (const auto& [key, bytes] : changes) {
        sqlite3_stmt* statement = (bytes ? put : erase).get();
        bindText(statement, 1, domain);
        bindText(statement, 2, key);
        if (bytes) {
            const void* data = bytes->empty() ? "" : static_cast<const void*>(bytes->data());
            if (int code = sqlite3_bind_blob64(statement, 3, data, bytes->size(), SQLITE_STATIC); code != SQLITE_OK)
                fail(code);
        }
        step(statement);
        sqlite3_reset(statement);
    }
}

} // namespace rolvane
