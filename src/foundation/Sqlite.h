#pragma once

#include "foundation/Value.h"

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <string_view>

struct sqlite3;
struct sqlite3_stmt;

namespace rolvane {

// An operation that SQLite could not do.
struct SqliteFailure {
    int code = 0;        // SQLite's, extended where it is known
    int systemError = 0; // errno, 0 when the system did not say no
    std::string detail;  // SQLite's words
    std::string doing;   // "open", "read", "write to", "use"

    // `handle` may be null: then nothing but the code is known.
    static SqliteFailure of(sqlite3* handle, int code, std::string_view doing);
    bool isDamage() const; // the file's content is wrong
};

// Why, and what to do, in a few words; the sentence before it says which file. For any kind of file.
std::string cxExplanation(const SqliteFailure& failure);

// Tells a failure as its owner's users understand it: always throws a CXException.
using SqliteErrors = void (*)(const std::string& path, const SqliteFailure& failure);

// A CXException kCXDatabaseException of "the database" at that path.
[[noreturn]] void throwSqliteError(const std::string& path, const SqliteFailure& failure);

// One connection. Not locked: its owner sees to it that one thread at a time uses it. Every failure throws.
class Sqlite {
    struct Prepared;

public:
    enum class Missing { make, refuse }; // a missing file is made, for nobody but its owner (0600), or is an error

    // Waits so long for other writers before "in use" is an error.
    Sqlite(const std::string& path, int busyTimeoutMilliseconds, SqliteErrors errors = throwSqliteError,
           Missing missing = Missing::make);
    ~Sqlite();
    Sqlite(const Sqlite&) = delete;
    Sqlite& operator=(const Sqlite&) = delete;

    // A prepared statement on loan: parameters are numbered from 1, columns from 0. Reset when it goes out of scope.
    class Statement {
    public:
        Statement(Sqlite& database, std::shared_ptr<Prepared> prepared);
        ~Statement();
        Statement(const Statement&) = delete;
        Statement& operator=(const Statement&) = delete;

        Statement& bind(int index, int64_t value);
        Statement& bind(int index, int value) { return bind(index, static_cast<int64_t>(value)); }
        Statement& bind(int index, double value);
        Statement& bind(int index, std::string_view text); // copied
        Statement& bind(int index, const Bytes& bytes);    // borrowed until the statement ends
        bool step();                                       // true: a row is there
        void run() { step(); }
        void reset(); // for another round with new parameters

        int64_t integer(int column) const;
        double real(int column) const;
        std::string text(int column) const;
        std::string_view textView(int column) const; // until the next step
        Bytes bytes(int column) const;
        bool isNull(int column) const;

    private:
        void check(int code) const;
        Sqlite& _database;
        std::shared_ptr<Prepared> _prepared;
    };

    bool hasMoved() const; // its path names another file by now, or none

    // Commands cannot change the file in ways that are not its content's, and what its schema says is not trusted.
    void guard();

    Statement statement(std::string_view sql); // kept prepared; a second loan of one text prepares another
    void execute(const std::string& sql);      // any number of statements, no results
    int64_t integer(std::string_view sql);     // first column of the first row, 0 when there is none
    int changes() const;                       // rows changed by the last statement
    int64_t lastInsertId() const;
    // A large value as a whole, in memory once. Within a view of the file that the row was found in.
    Bytes blob(const char* table, const char* column, int64_t row, size_t size);
    const std::string& path() const { return _path; }

    // What SQLite, or whoever compared what it says, has found damaged in the file; "" when nothing was.
    const std::string& damage() const { return _damage; }
    void noteDamage(const std::string& what) { _damage = what; }
    void forgetDamage() { _damage.clear(); }

private:
    friend class Statement;
    friend class SqliteTransaction;
    friend class SqliteSnapshot;
    std::shared_ptr<Prepared> prepare(std::string_view sql);
    [[noreturn]] void fail(int code, std::string_view doing);

    std::string _path;
    SqliteErrors _errors;
    sqlite3* _handle = nullptr;
    std::string _damage;
    bool _writing = false; // a write transaction is open: what fails now is the writing
    std::map<std::string, std::shared_ptr<Prepared>, std::less<>> _prepared;
};

// A write transaction (BEGIN IMMEDIATE): rolled back unless committed.
class SqliteTransaction {
public:
    explicit SqliteTransaction(Sqlite& database);
    ~SqliteTransaction();
    SqliteTransaction(const SqliteTransaction&) = delete;
    SqliteTransaction& operator=(const SqliteTransaction&) = delete;
    void commit();

private:
    Sqlite& _database;
    bool _open = true;
};

// One unchanging view for several reads: that of the first of them. Inside another one it is part of that.
class SqliteSnapshot {
public:
    explicit SqliteSnapshot(Sqlite& database);
    ~SqliteSnapshot();
    SqliteSnapshot(const SqliteSnapshot&) = delete;
    SqliteSnapshot& operator=(const SqliteSnapshot&) = delete;

private:
    Sqlite& _database;
    const bool _isOuter;
};

} // namespace rolvane
