#include "foundation/Sqlite.h"

#include "foundation/CXException.h"

#include <cstdlib>
#include <fcntl.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

namespace rolvane {

namespace {

// The mode holds whatever the umask is; an existing file keeps its own.
void makePrivateFile(const std::string& path) {
    int fd = ::open(path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
    if (fd < 0) return; // there already, or the opening that follows says why not
    ::fchmod(fd, 0600);
    ::close(fd);
}

} // namespace

SqliteFailure SqliteFailure::of(sqlite3* handle, int code, std::string_view doing) {
    // The connection may speak of another failure by now.
    const bool isOfHandle = handle && (sqlite3_extended_errcode(handle) & 0xff) == (code & 0xff);
    return {code, isOfHandle ? sqlite3_system_errno(handle) : 0,
            isOfHandle ? sqlite3_errmsg(handle) : sqlite3_errstr(code), std::string(doing)};
}

bool SqliteFailure::isDamage() const {
    return (code & 0xff) == SQLITE_CORRUPT || (code & 0xff) == SQLITE_NOTADB;
}

std::string cxExplanation(const SqliteFailure& failure) {
    const std::string& detail = failure.detail;
    if (failure.code == SQLITE_IOERR_WRITE) // a quota or a limit on file sizes looks like this
        return "no room is left for it on its disk, or the disk is failing. Nothing stored was lost; free some space "
               "and try again.";
    switch (failure.code & 0xff) {
    case SQLITE_FULL: return "no room is left on its disk. Nothing stored was lost; free some space and try again.";
    case SQLITE_BUSY:
    case SQLITE_LOCKED:
        return "another program has kept it locked for too long. Nothing was lost; try again in a moment.";
    case SQLITE_READONLY:
    case SQLITE_PERM:
    case SQLITE_AUTH:
        return "it cannot be written (" + detail + "). Check the permissions of the file and of its directory.";
    case SQLITE_CANTOPEN:
        return "it cannot be opened (" + detail + "). Check that its directory exists and the permissions of both.";
    case SQLITE_CORRUPT:
    case SQLITE_NOTADB: return "the file is damaged (" + detail + "). It was left as it is.";
    case SQLITE_IOERR: return "its disk reports an error (" + detail + "). Check the disk, then try again.";
    default: return detail + ". This is unexpected; please report it.";
    }
}

void throwSqliteError(const std::string& path, const SqliteFailure& failure) {
    throw CXException(kCXDatabaseException,
                      "Could not " + failure.doing + " the database " + path + ": " + cxExplanation(failure));
}

struct Sqlite::Prepared {
    sqlite3_stmt* statement = nullptr;
    bool onLoan = false;
    ~Prepared() { sqlite3_finalize(statement); }
};

Sqlite::Sqlite(const std::string& path, int busyTimeoutMilliseconds, SqliteErrors errors, Missing missing)
    : _path(path), _errors(errors) {
    if (missing == Missing::make) makePrivateFile(path);
    const int code = sqlite3_open_v2(path.c_str(), &_handle, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr);
    if (code != SQLITE_OK) {
        const SqliteFailure failure = SqliteFailure::of(_handle, code, "open");
        sqlite3_close_v2(_handle);
        _errors(path, failure);
    }
    sqlite3_extended_result_codes(_handle, 1);
    sqlite3_busy_timeout(_handle, busyTimeoutMilliseconds);
}

void Sqlite::fail(int code, std::string_view doing) {
    const SqliteFailure failure = SqliteFailure::of(_handle, code, doing);
    try {
        _errors(_path, failure);
    } catch (const CXException& e) {
        if (failure.isDamage()) _damage = e.reason();
        throw;
    }
    std::abort(); // `errors` always throws
}

Sqlite::~Sqlite() {
    _prepared.clear();
    // The log's path may belong to a successor of the file by now, and must not be taken away from it.
    if (hasMoved()) sqlite3_db_config(_handle, SQLITE_DBCONFIG_NO_CKPT_ON_CLOSE, 1, nullptr);
    sqlite3_close_v2(_handle);
}

void Sqlite::guard() {
    sqlite3_db_config(_handle, SQLITE_DBCONFIG_DEFENSIVE, 1, nullptr);
    sqlite3_db_config(_handle, SQLITE_DBCONFIG_TRUSTED_SCHEMA, 0, nullptr);
}

std::shared_ptr<Sqlite::Prepared> Sqlite::prepare(std::string_view sql) {
    auto made = std::make_shared<Prepared>();
    int code = sqlite3_prepare_v3(_handle, sql.data(), static_cast<int>(sql.size()), SQLITE_PREPARE_PERSISTENT,
                                  &made->statement, nullptr);
    if (code != SQLITE_OK) fail(code, "read");
    return made;
}

Sqlite::Statement Sqlite::statement(std::string_view sql) {
    auto found = _prepared.find(sql);
    if (found == _prepared.end()) found = _prepared.emplace(std::string(sql), prepare(sql)).first;
    if (found->second->onLoan) return Statement(*this, prepare(sql));
    return Statement(*this, found->second);
}

void Sqlite::execute(const std::string& sql) {
    int code = sqlite3_exec(_handle, sql.c_str(), nullptr, nullptr, nullptr);
    if (code != SQLITE_OK) fail(code, "use");
}

int64_t Sqlite::integer(std::string_view sql) {
    Statement s = statement(sql);
    return s.step() ? s.integer(0) : 0;
}

bool Sqlite::hasMoved() const {
    int moved = 0;
    return sqlite3_file_control(_handle, "main", SQLITE_FCNTL_HAS_MOVED, &moved) == SQLITE_OK && moved != 0;
}

int Sqlite::changes() const {
    return sqlite3_changes(_handle);
}
int64_t Sqlite::lastInsertId() const {
    return sqlite3_last_insert_rowid(_handle);
}

Bytes Sqlite::blob(const char* table, const char* column, int64_t row, size_t size) {
    Bytes bytes(size);
    sqlite3_blob* open = nullptr;
    int code = sqlite3_blob_open(_handle, "main", table, column, row, 0, &open);
    const std::unique_ptr<sqlite3_blob, int (*)(sqlite3_blob*)> closing(open, sqlite3_blob_close);
    if (code == SQLITE_OK && sqlite3_blob_bytes(open) != static_cast<int>(size)) code = SQLITE_CORRUPT;
    if (code == SQLITE_OK) code = sqlite3_blob_read(open, bytes.data(), static_cast<int>(size), 0);
    if (code != SQLITE_OK) fail(code, "read");
    return bytes;
}

Sqlite::Statement::Statement(Sqlite& database, std::shared_ptr<Prepared> prepared)
    : _database(database), _prepared(std::move(prepared)) {
    _prepared->onLoan = true;
}

Sqlite::Statement::~Statement() {
    reset();
    sqlite3_clear_bindings(_prepared->statement);
    _prepared->onLoan = false;
}

void Sqlite::Statement::reset() {
    sqlite3_reset(_prepared->statement);
}

void Sqlite::Statement::check(int code) const {
    if (code == SQLITE_OK) return;
    bool writing = _database._writing || !sqlite3_stmt_readonly(_prepared->statement);
    _database.fail(code, writing ? "write to" : "read");
}

Sqlite::Statement& Sqlite::Statement::bind(int index, int64_t value) {
    check(sqlite3_bind_int64(_prepared->statement, index, value));
    return *this;
}

Sqlite::Statement& Sqlite::Statement::bind(int index, double value) {
    check(sqlite3_bind_double(_prepared->statement, index, value));
    return *this;
}

Sqlite::Statement& Sqlite::Statement::bind(int index, std::string_view text) {
    check(sqlite3_bind_text64(_prepared->statement, index, text.data() ? text.data() : "", text.size(),
                              SQLITE_TRANSIENT, SQLITE_UTF8));
    return *this;
}

Sqlite::Statement& Sqlite::Statement::bind(int index, const Bytes& bytes) {
    if (bytes.empty())
        check(sqlite3_bind_zeroblob(_prepared->statement, index, 0));
    else
        check(sqlite3_bind_blob64(_prepared->statement, index, bytes.data(), bytes.size(), SQLITE_STATIC));
    return *this;
}

bool Sqlite::Statement::step() {
    int code = sqlite3_step(_prepared->statement);
    if (code == SQLITE_ROW) return true;
    if (code != SQLITE_DONE) check(code);
    return false;
}

int64_t Sqlite::Statement::integer(int column) const {
    return sqlite3_column_int64(_prepared->statement, column);
}
double Sqlite::Statement::real(int column) const {
    return sqlite3_column_double(_prepared->statement, column);
}

std::string Sqlite::Statement::text(int column) const {
    return std::string(textView(column));
}

std::string_view Sqlite::Statement::textView(int column) const {
    const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(_prepared->statement, column));
    if (!text) return {};
    return {text, static_cast<size_t>(sqlite3_column_bytes(_prepared->statement, column))};
}

Bytes Sqlite::Statement::bytes(int column) const {
    const auto* data = static_cast<const uint8_t*>(sqlite3_column_blob(_prepared->statement, column));
    if (!data) return {};
    return {data, data + sqlite3_column_bytes(_prepared->statement, column)};
}

bool Sqlite::Statement::isNull(int column) const {
    return sqlite3_column_type(_prepared->statement, column) == SQLITE_NULL;
}

SqliteTransaction::SqliteTransaction(Sqlite& database) : _database(database) {
    _database._writing = true;
    try {
        _database.statement("BEGIN IMMEDIATE").run();
    } catch (...) {
        _database._writing = false;
        throw;
    }
}

SqliteTransaction::~SqliteTransaction() {
    _database._writing = false;
    if (!_open) return;
    try {
        _database.statement("ROLLBACK").run();
    } catch (const CXException&) {
        // SQLite has rolled back by itself: that is what it does after a full disk or a failed read.
    }
}

void SqliteTransaction::commit() {
    _database.statement("COMMIT").run();
    _open = false;
}

SqliteSnapshot::SqliteSnapshot(Sqlite& database)
    : _database(database), _isOuter(sqlite3_get_autocommit(database._handle) != 0) {
    if (_isOuter) _database.statement("BEGIN").run();
}

SqliteSnapshot::~SqliteSnapshot() {
    if (!_isOuter) return;
    try {
        _database.statement("COMMIT").run();
    } catch (const CXException&) {
        // A reading transaction has nothing to lose.
    }
}

} // namespace rolvane
