#pragma once

#include "foundation/Date.h"
#include "foundation/Sqlite.h"
#include "foundation/StrongString.h"

#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

enum class CXDetailKind { added = 1, changed = 2, deleted = 3, joined = 4, left = 5, chosen = 6 };

// One thing that a change did to one record.
struct CXChangeDetail {
    int64_t number = 0, change = 0; // given by the log; numbers grow
    UniqueId uniqueId;              // the person or group; of joined and left the member
    CXDetailKind kind = CXDetailKind::changed;
    UniqueId group; // of joined, left and chosen
    // Encoded, as it was before: the properties of what was changed or deleted; of chosen {"property": string,
    // "identifier": string, missing where there was no choice}. Null for the others.
    std::shared_ptr<const Bytes> before;
};

// The changes of one command, or of one save of another program.
struct CXLoggedChange {
    int64_t number = 0;
    Date date; // of the first save of it
    std::string program, command;
    bool isUndone = false;
    size_t people = 0, groups = 0; // records that it has to do with
};

// The table of changes of people and groups with what they were before, so that a change can be told and taken back.
// Not locked. The writing operations want an open transaction.
//
// Kept for 30 days, and not more than 128 MB of details: whole changes leave, the oldest first. What leaves with its
// subscription is not in it: subscribing brings that back.
class ChangeLog {
public:
    explicit ChangeLog(Sqlite& database, int64_t bytesKept = kBytesKept) : _database(database), _bytesKept(bytesKept) {}

    static constexpr double kSecondsKept = 30 * 86400.0;
    static constexpr int64_t kBytesKept = 128 << 20;
    static constexpr const char* kTable = R"(
CREATE TABLE IF NOT EXISTS changes(
  id INTEGER PRIMARY KEY AUTOINCREMENT,
  date REAL NOT NULL,
  program TEXT NOT NULL,
  command TEXT NOT NULL,
  bytes INTEGER NOT NULL,
  total INTEGER NOT NULL,
  undone INTEGER NOT NULL DEFAULT 0);
CREATE TABLE IF NOT EXISTS details(
  id INTEGER PRIMARY KEY AUTOINCREMENT,
  change INTEGER NOT NULL,
  uid TEXT NOT NULL,
  kind INTEGER NOT NULL,
  other TEXT,
  before BLOB);
CREATE INDEX IF NOT EXISTS details_change ON details(change);
CREATE INDEX IF NOT EXISTS details_uid ON details(uid);
)";

    // From now on all saves of this process are one change.
    void savesAreOne(std::string command) { _command = std::move(command); }

    std::vector<CXLoggedChange> latest(size_t limit, const std::optional<UniqueId>& of); // newest first
    std::optional<CXLoggedChange> find(int64_t change);
    std::vector<CXChangeDetail> details(int64_t change, const std::optional<UniqueId>& of); // oldest first
    // The next detail of the record behind this one that holds its properties.
    std::optional<CXChangeDetail> next(const CXChangeDetail& detail);
    // Has a later change touched the properties of the record?
    bool isTouchedAfter(const CXChangeDetail& detail);
    // All that were deleted, with what they were, newest first.
    std::vector<CXChangeDetail> deleted();
    // The number of the last change until that moment. Nothing where the log does not reach back so far, or the clock
    // was set back from there.
    std::optional<int64_t> lastUntil(Date moment);
    // The first move of the member behind that change, into the group or out of it. Nothing: there is none.
    std::optional<CXDetailKind> firstMoveBehind(int64_t change, const UniqueId& group, const UniqueId& member);

    // Within a transaction: one save notes what it does, then `finish`; `wasCommitted` when that is durable.
    void begin(const std::string& program, Date date);
    void note(const UniqueId& uid, CXDetailKind kind, const UniqueId& group = {}, const Bytes* before = nullptr);
    void finish();
    void wasCommitted() { _open = _command.empty() ? 0 : _current; }
    void setUndone(int64_t change);
    void forget(const UniqueId& uid);

private:
    std::vector<CXChangeDetail> selected(std::string_view condition, int64_t number, const UniqueId& uid);
    CXLoggedChange read(Sqlite::Statement& row);
    void prune();

    Sqlite& _database;
    const int64_t _bytesKept;
    std::string _command, _program;
    Date _date;
    int64_t _open = 0;    // of earlier saves that are one with the next
    int64_t _current = 0; // of the save that is under way
    int64_t _bytes = 0;
};

} // namespace rolvane
