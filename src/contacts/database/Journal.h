#pragma once

#include "contacts/database/CXRolvane.h"
#include "foundation/Sqlite.h"

#include <optional>

namespace rolvane {

// The program that serves the address books; where its journal ends it compares everything.
inline constexpr std::string_view kCXBooksProgram = "books";

// The journal of saves and the programs' cursors in it. Not locked. A save is one row of "saves" (who, when, a random
// token that tells histories apart) with one "journal" row per changed record; sequences grow and are never used again.
class Journal {
public:
    explicit Journal(Sqlite& database) : _database(database) {}

    int64_t position(); // sequence of the latest entry ever written, 0 when there was none
    std::vector<CXJournalEntry> entries(int64_t after, size_t limit);
    // Entries behind `after` up to `until` that other programs wrote.
    std::vector<CXJournalEntry> foreignEntries(int64_t after, int64_t until, const std::string& program);
    bool hasForeignEntries(int64_t after, const std::string& program);
    // The first of them from a save dated at or before the date.
    std::optional<int64_t> firstForeignNotAfter(int64_t after, int64_t until, const std::string& program, Date date);

    std::optional<int64_t> cursor(const std::string& program);
    void setCursor(const std::string& program, int64_t sequence); // never backwards; durable on return

    std::string latestToken(); // "" before the first save
    bool hasToken(const std::string& token);

    // Within a transaction.
    int64_t beginSave(int64_t processID, const std::string& program, Date date);
    void note(int64_t save, const UniqueId& uid, CXChangeKind kind);
    void prune(); // what every cursor has passed, but for the last 1,000 entries

private:
    Sqlite& _database;
};

// What one notification says of several entries. Pure. Per record the net effect: gone at the end is deleted, new
// since the first entry is inserted, else updated; in order of first mention. An entry for a group's contents is left
// out when the group itself is mentioned. `ownProcessID` is never given as the sender: an identifier that the system
// has handed out again says 0.
Dictionary joinedChanges(const std::vector<CXJournalEntry>& entries, int64_t ownProcessID);

} // namespace rolvane
