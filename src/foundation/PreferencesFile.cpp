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

bool hadNoRoom(const SqliteFailure& failure) {
    return (failure.code & 0xff) == SQLITE_FULL || failure.systemError == ENOSPC || failure.systemError == EDQUOT ||
           failure.systemError == EFBIG;
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
std::string explain(const std::string& path, const SqliteFailure& failure) {
    const auto& [code, systemError, detail, doing] = failure;
    if (hadNoRoom(failure))
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

[[noreturn]] void throwPreferencesError(const std::string& path, const SqliteFailure& failure) {
    failWith(explain(path, failure));
}

} // namespace

PreferencesFile::PreferencesFile(std::string path, double lockTimeoutSeconds)
    : _path(std::move(path)), _lockTimeout(lockTimeoutSeconds) {}

void PreferencesFile::open() {
    giveJournalTheRightsOf(_path);
    _tableSeen = false;
    _database = std::make_unique<Sqlite>(_path, static_cast<int>(_lockTimeout * 1000), throwPreferencesError,
                                         Sqlite::Missing::refuse);
    try {
        _database->guard();
        checkFormat();
        _database->execute("PRAGMA synchronous=FULL; PRAGMA journal_size_limit=4194304");
    } catch (...) {
        _database.reset();
        throw;
    }
}

void PreferencesFile::checkFormat() {
    int64_t tables = 0, application = 0, version = 0;
    {
        const SqliteSnapshot view(*_database); // another process may be making the file now
        tables = _database->integer("SELECT count(*) FROM sqlite_master");
        application = _database->integer("PRAGMA application_id");
        version = _database->integer("PRAGMA user_version");
    }
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
    if (_database && _database->hasMoved()) _database.reset();
    if (!_database) {
        if (!exists(_path)) {
            if (errno == ENOENT || errno == ENOTDIR) return false;
            throwPreferencesError(_path, {SQLITE_CANTOPEN, errno, "no access", "open"});
        }
        open();
    }
    return hasTable();
}

void PreferencesFile::createFile() {
    CXPathUtils_MakeCompletePath(directoryOf(_path), 0700);
    const int fd = ::open(_path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
    if (fd < 0) {
        if (errno == EEXIST) return; // another process was faster
        const int code = errno == EROFS || errno == EACCES ? SQLITE_READONLY : SQLITE_CANTOPEN;
        throwPreferencesError(_path, {code, errno, std::strerror(errno), "make"});
    }
    ::fchmod(fd, 0600); // whatever the umask
    ::close(fd);
}

void PreferencesFile::openOrCreate() {
    if (openExisting()) return;
    if (!_database) {
        createFile();
        open();
    }
    try {
        _database->execute("PRAGMA journal_mode=WAL");
    } catch (const CXException&) {
        // Refused on a file system without shared memory and while another process makes the file: the rollback
        // journal serves as well.
    }
}

bool PreferencesFile::hasTable() {
    if (!_tableSeen)
        _tableSeen = _database->integer("SELECT count(*) FROM sqlite_master WHERE name = 'preferences'") != 0;
    return _tableSeen;
}

std::optional<Bytes> PreferencesFile::read(std::string_view domain, std::string_view key) {
    if (!openExisting()) return {};
    auto statement =
        _database->statement("SELECT rowid, length(value) FROM preferences WHERE domain = ?1 AND key = ?2");
    if (!statement.bind(1, domain).bind(2, key).step()) return {};
    // The open statement keeps the view.
    return _database->blob("preferences", "value", statement.integer(0), static_cast<size_t>(statement.integer(1)));
}

std::vector<std::string> PreferencesFile::keys(std::string_view domain) {
    std::vector<std::string> keys;
    if (!openExisting()) return keys;
    auto statement = _database->statement("SELECT key FROM preferences WHERE domain = ?1 ORDER BY key");
    for (statement.bind(1, domain); statement.step();) keys.push_back(statement.text(0));
    return keys;
}

std::vector<std::string> PreferencesFile::domains() {
    std::vector<std::string> domains;
    if (!openExisting()) return domains;
    auto statement = _database->statement("SELECT DISTINCT domain FROM preferences ORDER BY domain");
    while (statement.step()) domains.push_back(statement.text(0));
    return domains;
}

void PreferencesFile::write(std::string_view domain, const Changes& changes) {
    openOrCreate();
    try {
        SqliteTransaction transaction(*_database);
        if (!hasTable())
            _database->execute(
                fmt::format("CREATE TABLE preferences (domain TEXT NOT NULL, key TEXT NOT NULL, value BLOB NOT NULL, "
                            "PRIMARY KEY (domain, key)) STRICT; "
                            "PRAGMA application_id={}; PRAGMA user_version={}",
                            kApplicationID, kFormatVersion));
        applyChanges(domain, changes);
        transaction.commit();
    } catch (...) {
        _tableSeen = false;
        throw;
    }
}

void PreferencesFile::applyChanges(std::string_view domain, const Changes& changes) {
    auto put = _database->statement("INSERT INTO preferences (domain, key, value) VALUES (?1, ?2, ?3) "
                                    "ON CONFLICT (domain, key) DO UPDATE SET value = excluded.value");
    auto erase = _database->statement("DELETE FROM preferences WHERE domain = ?1 AND key = ?2");
    for (const auto& [key, bytes] : changes) {
        auto& statement = bytes ? put : erase;
        statement.bind(1, domain).bind(2, key);
        if (bytes) statement.bind(3, *bytes);
        statement.run();
        statement.reset();
    }
}

} // namespace rolvane
