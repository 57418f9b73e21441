#pragma once

#include "foundation/Date.h"
#include "foundation/Sqlite.h"
#include "foundation/StrongString.h"

#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane::cardbook {

// A card of a book, or one that has left it.
struct Member {
    UniqueId uid;
    std::string name; // the last part of its path
    Date modified;    // of the record, as the contact database has it
    int64_t sequence = 0;
    bool gone = false;
};

// Text of a card as its client wrote it.
struct WrittenCard {
    std::string text;
    bool isVersion4 = false;
};

// The books' memory beside the contact database, in a file of its own: which card is called what in which book,
// at which of the books' sequence numbers it changed last or left, and the text that a client wrote. A file that is
// missing is made anew; then tokens of earlier ones say nothing. Not locked: one
// thread at a time. Errors as Sqlite's. Durable when a transaction has ended.
class BookMemory {
public:
    static constexpr int64_t kDeparturesKept = 10000;

    BookMemory(const std::string& path, int busyTimeoutMilliseconds, int64_t departuresKept = kDeparturesKept);

    Sqlite& sqlite() { return _sqlite; }

    bool isOfPast() const { return _sqlite.hasMoved(); } // another file has its path
    std::string epoch();                                 // names this memory in tokens
    int64_t latest(std::string_view book);
    int64_t forgottenUntil(std::string_view book); // departures up to this number are not known any more
    int64_t begun(std::string_view book);          // tokens of an earlier book of that name are below it
    int64_t position();                            // of the contact database's journal; -1: nothing was read yet
    Bytes history();                               // the mark of the contact database that belongs to the position

    std::optional<Member> named(std::string_view book, std::string_view name); // never one that has left
    std::optional<Member> of(std::string_view book, const UniqueId& uid);
    std::optional<Member> departed(std::string_view book, std::string_view name); // one that has left, lately
    // Those behind a number, in its order.
    std::vector<Member> after(std::string_view book, int64_t sequence, bool withGone, size_t limit);
    std::vector<std::string> booksWith(const UniqueId& uid); // in which it is
    std::vector<std::string> books();                        // known ones
    std::vector<UniqueId> uidsOf(std::string_view book);

    // Every change stands in one of these. Rolled back unless committed.
    class Change {
    public:
        explicit Change(BookMemory& memory);
        ~Change();
        Change(const Change&) = delete;
        Change& operator=(const Change&) = delete;
        void commit();

    private:
        BookMemory& _memory;
        SqliteTransaction _transaction;
    };

    // Within a change ---------------------------------------------------------------------------------------
    void setPosition(int64_t position, const Bytes& history);
    // The card is in the book, at that state. True when that is news.
    bool note(std::string_view book, const UniqueId& uid, Date modified);
    // A card that then stands in no book leaves no text behind.
    bool noteGone(std::string_view book, const UniqueId& uid);
    void ensureBook(std::string_view book);
    void noteBookGone(std::string_view book);
    // The name that the next `note` of the card in that book gives it.
    void wish(std::string_view book, const UniqueId& uid, std::string_view name);
    void rename(std::string_view book, const Member& member, std::string_view name); // to one that is free
    void forgetOldDepartures();
    // A comparison of everything: between the two, every card that is there is noted, and every group that waits; the
    // others are then gone.
    void beginComparison();
    void endComparison();

    // The UIDs, by vcardMemberKey, of cards whose people were joined with this one.
    void setJoined(const UniqueId& uid, const std::vector<std::string>& keys);
    std::optional<UniqueId> joinedAs(const std::string& key);

    // The members that the group's card names and that are nowhere, by vcardMemberKey.
    void setWaiting(const UniqueId& group, const std::set<std::string>& keys);
    std::vector<UniqueId> waitingFor(const std::string& key); // groups; perhaps one that has gone

    // Texts: of a record with that digest of its properties.
    std::optional<WrittenCard> written(const UniqueId& uid, const Bytes& digest);
    bool hasWritten(const UniqueId& uid);
    void setWritten(const UniqueId& uid, const Bytes& digest, const WrittenCard& card);
    void keepWrittenOnly(const UniqueId& uid, const Bytes& digest);

private:
    int64_t nextSequence();
    bool leave(std::string_view book, const UniqueId& uid);
    int64_t numberOf(std::string_view book, bool make);
    std::string nameFor(int64_t book, const UniqueId& uid);
    bool isTaken(int64_t book, std::string_view name, const UniqueId& uid);
    std::string setting(std::string_view key);
    void set(std::string_view key, std::string_view value);

    Sqlite _sqlite;
    const int64_t _departuresKept;
    int64_t _comparison = 0;
    int64_t _sequence = 0; // of the open change
};

} // namespace rolvane::cardbook
