#include "TestDatabase.h"

#include "contacts/database/Journal.h"

#include <map>
#include <random>
#include <set>

namespace rolvane::test {
namespace {

constexpr const char* kApplication = "rolvane";
constexpr const char* kDaemon = "RolvaneManager";

// A daemon that knows the database by full scans and by what it is told, another program that edits at any time, and
// beside them the plain rule: what no finished scan has taken and what was not told yet is told, once. A daemon that is
// started again is told everything behind the first of that once more.
class TwoReaders {
public:
    explicit TwoReaders(uint32_t seed) : _random(seed) {
        _daemon.database->cursorPosition();
        _application = _daemon.open(kApplication);
        _observation = observe();
    }

    void step() {
        switch (pick(12)) {
        case 0: _daemon.clock.advance(1); break;
        case 1: _daemon.clock.advance(pick(4) == 0 ? -3 : 0.5); break;
        case 2: daemonSaves(); break;
        case 3: beginScan(); break;
        case 4: endScan(); break;
        case 5:
            if (!_scan) deliver();
            break;                                                  // a pass is not interrupted
        case 6: pick(4) == 0 ? startAgain() : _scan.reset(); break; // or a pass that came to no end
        case 7: fullPass(); break;
        default: applicationSaves();
        }
    }

    void end() {
        _scan.reset();
        for (int i = 0; i < 2; ++i) deliver();
        EXPECT_FALSE(_daemon->hasExternalChanges());
        std::map<std::string, std::string> all;
        _daemon->forEachPersonModifiedSince(Date::distantPast(), kCXPersonTable, [&](const CXRow& row) {
            if (row.writer == kApplication) all[row.uniqueId.str()] = nameOf(row.uniqueId);
        });
        EXPECT_EQ(_known, all);
    }

private:
    struct Entry {
        CXJournalEntry is;
        bool scanned = false, told = false;
    };
    struct Scan {
        int64_t position;
        Date since;
        std::map<std::string, std::string> modified;
        std::set<std::string> all;
    };

    int pick(int below) { return std::uniform_int_distribution<int>(0, below - 1)(_random); }

    std::string nameOf(const UniqueId& uid) {
        const CXRecordRef record = _daemon->recordForUniqueId(uid);
        return record ? record->valueForProperty(kCXFirstNameProperty).string() : std::string();
    }

    // One to three edits of five people: added, renamed, removed, or removed and made anew at once.
    void applicationSaves() {
        for (int edits = 1 + pick(3); edits > 0; --edits) {
            const UniqueId uid(std::string(1, static_cast<char>('A' + pick(5))) + ":CXPerson");
            const std::string name = "name " + std::to_string(++_edits);
            const CXRecordRef held = _application->recordForUniqueId(uid);
            const int kind = pick(4);
            if (held && kind == 0) held->setValue(Value(name), kCXFirstNameProperty);
            if (held && kind > 0) _application->removeRecord(held);
            if (!held || kind > 1) TestDatabase::addPersonTo(*_application, name, uid.str());
        }
        _application->save();
        readJournal();
    }

    void daemonSaves() {
        const UniqueId uid("Own:CXPerson");
        if (const CXRecordRef held = _daemon->recordForUniqueId(uid))
            held->setValue(Value("own " + std::to_string(++_edits)), kCXFirstNameProperty);
        else
            _daemon.addPerson("own", uid.str());
        _daemon->save();
    }

    void readJournal() {
        const int64_t last = _journal.empty() ? 0 : _journal.back().is.sequence;
        for (const CXJournalEntry& entry : _application->journalEntries(last, 1000))
            if (entry.program == kApplication) _journal.push_back({entry});
    }

    void beginScan() {
        const CXRolvane::OneMoment moment(*_daemon);
        Scan scan{_daemon->journalPosition(), _lastSync, {}, {}};
        _daemon->forEachPersonModifiedSince(_lastSync, kCXPersonTable, [&](const CXRow& row) {
            if (row.writer == kApplication) scan.modified[row.uniqueId.str()] = nameOf(row.uniqueId);
        });
        for (const UniqueId& uid : _daemon->peopleOfTable(kCXPersonTable)) scan.all.insert(uid.str());
        _scan = std::move(scan);
    }

    // What was changed since comes from the rows, what is gone from the comparison of everybody.
    void endScan() {
        if (!_scan) return;
        for (const auto& [uid, name] : _scan->modified) _known[uid] = name;
        std::erase_if(_known, [&](const auto& known) { return !_scan->all.contains(known.first); });
        _lastSync = _daemon.clock.now();
        _daemon->advanceCursorTo(_scan->position, _scan->since);
        for (Entry& entry : _journal)
            if (entry.is.sequence <= _scan->position && entry.is.date > _scan->since) entry.scanned = true;
        _scan.reset();
    }

    void fullPass() {
        beginScan();
        endScan();
    }

    void deliver() {
        std::vector<CXJournalEntry> expected;
        for (Entry& entry : _journal)
            if (!entry.scanned && !entry.told) expected.push_back(entry.is);
        EXPECT_EQ(_daemon->hasExternalChanges(), !expected.empty());
        _heard.reset();
        EXPECT_EQ(_daemon->deliverExternalChanges(), !expected.empty());
        for (Entry& entry : _journal) entry.told = true;
        ASSERT_EQ(_heard.has_value(), !expected.empty());
        if (!_heard) return;
        const Dictionary joined = joinedChanges(expected, ::getpid());
        for (const char* list : {kCXInsertedRecords, kCXUpdatedRecords, kCXDeletedRecords})
            EXPECT_EQ((*_heard)[list], joined[list]) << list;
    }

    void hear(const Dictionary& told) {
        _heard = told;
        for (const char* list : {kCXInsertedRecords, kCXUpdatedRecords, kCXDeletedRecords})
            for (const Value& uid : told[list].array()) {
                const std::string name = nameOf(UniqueId(uid.string()));
                if (name.empty())
                    _known.erase(uid.string());
                else
                    _known[uid.string()] = name;
            }
    }

    void startAgain() {
        _scan.reset();
        _daemon.reopen();
        bool behind = false;
        for (Entry& entry : _journal) {
            behind = behind || (!entry.scanned && !entry.told);
            if (behind) entry.scanned = entry.told = false;
        }
    }

    ObservationHandle observe() {
        return _daemon.center.observe(kCXDatabaseChangedExternallyNotificationPriv,
                                      [this](const Notification& n) { hear(n.userInfo); });
    }

    std::mt19937 _random;
    TestDatabase _daemon;
    std::unique_ptr<CXRolvane> _application;
    ObservationHandle _observation;
    int _edits = 0;
    Date _lastSync = Date::distantPast();
    std::vector<Entry> _journal; // the application's
    std::optional<Scan> _scan;
    std::optional<Dictionary> _heard;
    std::map<std::string, std::string> _known; // the daemon's memory: name by identifier
};

TEST(TheJournal, WithScansInBetweenTellsWhatNoScanHasTakenAndThatOnce) {
    for (uint32_t seed = 1; seed <= 12 && !testing::Test::HasFailure(); ++seed) {
        SCOPED_TRACE(seed);
        TwoReaders readers(seed);
        for (int i = 0; i < 80; ++i) readers.step();
        readers.end();
    }
}

} // namespace
} // namespace rolvane::test
