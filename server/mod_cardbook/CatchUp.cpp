#include "server/mod_cardbook/CatchUp.h"

#include "contacts/vcard/VCardFields.h"
#include "contacts/vcard/VCardReader.h"
#include "foundation/PropertyList.h"
#include "server/mod_cardbook/Place.h"

#include <algorithm>
#include <map>
#include <set>

namespace rolvane::cardbook {
namespace {

constexpr size_t kPage = 1000;

std::string bookOfGroup(const UniqueId& group) {
    return std::string(kGroupBook) + std::string(cxUUIDPart(group));
}

std::string bookOfSubscription(const CXSubscription& subscription) {
    return std::string(kSharedBook) + std::string(cxUUIDPart(subscription.uniqueId()));
}

// Locations and the books of their subscriptions.
std::map<std::string, std::string> sharedBooks(CXRolvane& rolvane) {
    std::map<std::string, std::string> all;
    for (const CXSubscriptionRef& subscription : rolvane.subscriptions())
        if (!subscription->isLocal()) all[subscription->remoteLocation().str()] = bookOfSubscription(*subscription);
    return all;
}

class CatchingUp {
public:
    CatchingUp(CXRolvane& rolvane, BookMemory& memory) : _rolvane(rolvane), _memory(memory) {}

    // False: the journal has been cut off between the position and its end.
    bool read(int64_t from, int64_t until) {
        std::set<UniqueId> records, groups;
        while (from < until) {
            const auto entries = _rolvane.journalEntries(from, kPage);
            if (entries.empty() || entries.front().sequence != from + 1) return false;
            for (const CXJournalEntry& entry : entries) sort(entry.uniqueId, records, groups);
            from = entries.back().sequence;
        }
        for (const UniqueId& uid : records) settle(uid);
        for (const UniqueId& uid : groups) settleGroup(uid);
        if (_mayDateOtherGroups)
            for (const CXListing& line : _rolvane.listGroups(std::nullopt)) settle(line.uniqueId);
        return true;
    }

    void compare() {
        _memory.beginComparison();
        for (const std::string_view table : {kCXPersonTable, kCXSubscribedPersonTable})
            _rolvane.forEachPersonModifiedSince(Date::distantPast(), table, [this](const CXRow& row) {
                for (const std::string& book : booksOf(row)) _memory.note(book, row.uniqueId, row.modified);
                noteJoined(row);
            });
        _memory.ensureBook(kContactsBook);
        for (const CXListing& line : _rolvane.listGroups(std::nullopt)) {
            settle(line.uniqueId);
            if (!cxIsSubscribed(line.uniqueId)) _memory.ensureBook(bookOfGroup(line.uniqueId));
        }
        settleBooks();
        _memory.endComparison();
    }

private:
    void sort(const UniqueId& uid, std::set<UniqueId>& records, std::set<UniqueId>& groups) {
        const std::string_view table = cxTableName(uid);
        if (table == kCXGroupContentsTable)
            groups.insert(cxUIDWithTableName(uid, kCXGroupTable));
        else if (table == kCXSubscribedGroupContentsTable)
            records.insert(cxUIDWithTableName(uid, kCXSubscribedGroupTable));
        else if (table == kCXGroupTable)
            groups.insert(uid);
        else if (table == kCXSubscriptionTable)
            settleBooks();
        else if (table != kCXInfoTable)
            records.insert(uid);
    }

    const std::map<std::string, std::string>& shared() {
        if (!_shared) _shared = sharedBooks(_rolvane);
        return *_shared;
    }

    std::vector<std::string> booksOf(const CXRow& row) {
        std::vector<std::string> books;
        if (cxIsSubscribed(row.uniqueId)) {
            const auto found = shared().find(row.location.str());
            if (found != shared().end()) books.push_back(found->second);
            return books;
        }
        books.emplace_back(kContactsBook);
        for (const UniqueId& group : row.parentGroups)
            if (!cxIsSubscribed(group)) books.push_back(bookOfGroup(group));
        return books;
    }

    // The line may stay when the person is deleted: nobody looks it up then.
    void noteJoined(const CXRow& row) {
        const std::string_view bytes(reinterpret_cast<const char*>(row.encoded->data()), row.encoded->size());
        std::vector<std::string> keys;
        if (bytes.find(kVCardJoinedUIDLine) != std::string_view::npos)
            for (const VCardLine& line :
                 vcardKeptLines(BinaryValue::decode(*row.encoded).dictionary(), kVCardJoinedUIDLine))
                keys.push_back(vcardMemberKey(vcardUnescape(line.value)));
        _memory.setJoined(row.uniqueId, keys);
    }

    void noteWaiting(const UniqueId& uid, const CXGroup* group) {
        std::set<std::string> keys;
        if (group && group->valueForProperty(kCXVCardExtraProperty))
            for (const VCardLine& line : vcardKeptLines(group->dictionaryRepresentation(), kVCardMissingMemberLine))
                keys.insert(vcardMemberKey(vcardUnescape(line.value)));
        _memory.setWaiting(uid, keys);
    }

    struct Whereabouts {
        Date modified;
        std::vector<std::string> books; // none: there is no such record
    };

    Whereabouts whereabouts(const UniqueId& uid) {
        if (!cxTableName(uid).ends_with("Group")) {
            const std::optional<CXRow> row = _rolvane.personRow(uid);
            if (row) noteJoined(*row);
            return row ? Whereabouts{row->modified, booksOf(*row)} : Whereabouts{};
        }
        const auto group = std::dynamic_pointer_cast<CXGroup>(_rolvane.recordForUniqueId(uid));
        if (!cxIsSubscribed(uid)) noteWaiting(uid, group.get());
        const auto modified = group ? group->valueForProperty(kCXModificationDateProperty).date() : std::nullopt;
        if (!modified || group->isAllGroup()) return {};
        if (!group->isSubscribed()) return {*modified, {std::string(kContactsBook)}};
        const auto found = shared().find(group->remoteLocation().str());
        return found == shared().end() ? Whereabouts{} : Whereabouts{*modified, {found->second}};
    }

    void settle(const UniqueId& uid) {
        const Whereabouts now = whereabouts(uid);
        for (const std::string& book : now.books) _memory.note(book, uid, now.modified);
        for (const std::string& book : _memory.booksWith(uid)) {
            if (std::find(now.books.begin(), now.books.end(), book) != now.books.end()) continue;
            _memory.noteGone(book, uid);
            // A removal dates the groups that it takes somebody out of, without a line in the journal for them. Books
            // tell the groups of an own person alone.
            if (book.starts_with(kGroupBook))
                settle(UniqueId(book.substr(kGroupBook.size()) + ":" + std::string(kCXGroupTable)));
            _mayDateOtherGroups |= cxIsSubscribed(uid) || cxTableName(uid).ends_with("Group");
        }
    }

    void settleGroup(const UniqueId& uid) {
        settle(uid);
        const std::string book = bookOfGroup(uid);
        const auto group = std::dynamic_pointer_cast<CXGroup>(_rolvane.recordForUniqueId(uid));
        if (!group) return _memory.noteBookGone(book);
        _memory.ensureBook(book);
        std::set<UniqueId> before;
        for (const UniqueId& member : _memory.uidsOf(book)) before.insert(member);
        std::vector<UniqueId> joined;
        for (const UniqueId& member : group->memberUniqueIds())
            if (before.erase(member) == 0) joined.push_back(member);
        for (const UniqueId& member : before) _memory.noteGone(book, member);
        _rolvane.forEachOf(joined, [&](const CXRow& row) { _memory.note(book, row.uniqueId, row.modified); });
    }

    // Books of subscriptions that have ended go whole. A new one's cards have lines of their own in the journal.
    void settleBooks() {
        _shared.reset();
        std::set<std::string> there;
        for (const auto& [location, book] : shared()) {
            there.insert(book);
            _memory.ensureBook(book);
        }
        for (const std::string& book : _memory.books())
            if (book.starts_with(kSharedBook) && !there.contains(book)) _memory.noteBookGone(book);
    }

    CXRolvane& _rolvane;
    BookMemory& _memory;
    std::optional<std::map<std::string, std::string>> _shared;
    bool _mayDateOtherGroups = false;
};

} // namespace

void catchUp(CXRolvane& rolvane, BookMemory& memory) {
    if (memory.position() == rolvane.journalPosition() && memory.position() >= 0) {
        const Bytes history = memory.history();
        if (!history.empty() && rolvane.isOfHistory(BinaryValue::decode(history).dictionary())) return;
    }
    BookMemory::Change change(memory);
    const Dictionary mark = rolvane.historyMark(); // before the journal is read, so never later than what was read
    const int64_t until = rolvane.journalPosition();
    const int64_t from = memory.position();
    const Bytes history = memory.history();
    const bool isKnown = from >= 0 && from <= until && !history.empty() &&
                         rolvane.isOfHistory(BinaryValue::decode(history).dictionary());
    CatchingUp catching(rolvane, memory);
    if (!isKnown || !catching.read(from, until)) catching.compare();
    memory.forgetOldDepartures();
    memory.setPosition(until, BinaryValue::encode(mark));
    change.commit();
    // Each move of the cursor is a write to the database, and a few lines more in its journal cost nothing.
    constexpr int64_t kLinesLeft = 200;
    if (until - rolvane.cursorPosition() > kLinesLeft) rolvane.advanceCursorTo(until, Date::distantPast());
}

} // namespace rolvane::cardbook
