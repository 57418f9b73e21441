#include "contacts/database/DaemonMemory.h"

#include "TestDatabase.h"
#include "foundation/CXException.h"
#include "foundation/Sqlite.h"

#include <filesystem>
#include <fstream>

namespace rolvane::test {
namespace {

constexpr const char* kQueue = "CXDPendingChanges";
constexpr const char* kSetting = "CXDDebugLevel";

struct Remembered : TestDatabase {
    std::string preferencesPath = directory / "state/preferences.db";
    Preferences preferences{preferencesPath, daemonMemory(path)};

    void put(const char* key, const Value& value) {
        preferences.set(kDaemonDomain, key, value);
        preferences.synchronize(kDaemonDomain);
    }
    Value seenByAnother(const char* key) const {
        const Preferences another(preferencesPath, daemonMemory(path));
        return another.get(kDaemonDomain, key);
    }
    Value inTheFile(const char* key) const { return Preferences(preferencesPath).get(kDaemonDomain, key); }
    int64_t rows(const std::string& key) const {
        return Sqlite(path, 1000).integer("SELECT count(*) FROM daemon WHERE key='" + key + "'");
    }
};

TEST(DaemonMemory, KeepsTheMemoryWithTheDatabaseAndLeavesWhatAPersonSets) {
    Remembered d;
    d.put(kQueue, "queue");
    d.put("CXDConduitData/CXDCX/ann/G1", "state");
    d.put(kSetting, 1);
    EXPECT_EQ(d.seenByAnother(kQueue), Value("queue"));
    EXPECT_EQ(d.rows(kQueue), 1);
    EXPECT_EQ(d.rows("CXDConduitData/CXDCX/ann/G1"), 1);
    EXPECT_EQ(d.rows(kSetting), 0);
    EXPECT_EQ(d.inTheFile(kSetting), Value(1));
    EXPECT_FALSE(d.inTheFile(kQueue));
    EXPECT_EQ(d.preferences.keys(kDaemonDomain),
              (std::vector<std::string>{"CXDConduitData/CXDCX/ann/G1", kSetting, kQueue}));
    EXPECT_EQ(d.preferences.domains(), std::vector<std::string>{kDaemonDomain});
    d.put(kQueue, Value());
    EXPECT_FALSE(d.seenByAnother(kQueue));
    EXPECT_EQ(d.rows(kQueue), 0);
}

// The states of many people are megabytes, and each pass reads some dates that lie among them.
TEST(DaemonMemory, ASmallValueIsFoundWithoutReadingTheLargeOnesBesideIt) {
    Remembered d;
    constexpr size_t kLarge = 4u << 20;
    for (const char* key : {"CXDConduitData/CXDCX/ann/G1", "CXDConduitData/CXDVaultra/ann/G1", "CXDPendingChanges"})
        d.preferences.set(kDaemonDomain, key, Bytes(kLarge, 7));
    d.put("CXDCXConduitLastSyncDate", 1);
    d.put("CXDShareCount", 2);
    const Preferences another(d.preferencesPath, daemonMemory(d.path));
    const auto bytesRead = [] {
        std::ifstream counts("/proc/self/io");
        std::string name;
        uint64_t bytes = 0;
        counts >> name >> bytes; // "rchar:"
        return bytes;
    };
    const uint64_t before = bytesRead();
    EXPECT_EQ(another.get(kDaemonDomain, "CXDShareCount"), Value(2));
    EXPECT_EQ(another.get(kDaemonDomain, "CXDCXConduitLastSyncDate"), Value(1));
    EXPECT_LT(bytesRead() - before, kLarge / 4);
}

TEST(DaemonMemory, ACopyOfTheDatabaseHasTheMemoryThatFitsIt) {
    Remembered d;
    d.put(kQueue, "then");
    d.database.reset();
    d.preferences.keepElsewhere(nullptr); // closes
    const std::string copy = d.directory / "copy.db";
    std::filesystem::copy_file(d.path, copy);
    EXPECT_EQ(Preferences(d.preferencesPath, daemonMemory(copy)).get(kDaemonDomain, kQueue), Value("then"));
}

TEST(DaemonMemory, WhatAnEarlierVersionLeftInThePreferencesMovesOnce) {
    Remembered d;
    Preferences earlier(d.preferencesPath);
    earlier.set(kDaemonDomain, kQueue, "old queue");
    earlier.set(kDaemonDomain, kSetting, 2);
    earlier.synchronize(kDaemonDomain);
    EXPECT_EQ(d.preferences.get(kDaemonDomain, kQueue), Value("old queue"));
    EXPECT_FALSE(d.inTheFile(kQueue));
    EXPECT_EQ(d.inTheFile(kSetting), Value(2));
    d.put(kQueue, "new queue");
    EXPECT_EQ(d.seenByAnother(kQueue), Value("new queue"));
}

TEST(DaemonMemory, AMoveThatWasCutOffIsRepeated) {
    Remembered d;
    Preferences earlier(d.preferencesPath);
    earlier.set(kDaemonDomain, kQueue, "old queue");
    earlier.synchronize(kDaemonDomain);
    daemonMemory(d.path)->write({{kQueue, Bytes{0xff}}}); // as far as it got: no value at all
    EXPECT_EQ(d.seenByAnother(kQueue), Value("old queue"));
    EXPECT_FALSE(d.inTheFile(kQueue));
}

TEST(DaemonMemory, WithoutADatabaseWhatIsInThePreferencesIsReadThereAndNoneIsMade) {
    Remembered d;
    d.database.reset();
    std::filesystem::remove_all(d.directory / "data");
    Preferences earlier(d.preferencesPath);
    earlier.set(kDaemonDomain, kQueue, "old queue");
    earlier.synchronize(kDaemonDomain);
    EXPECT_EQ(d.preferences.get(kDaemonDomain, kQueue), Value("old queue"));
    EXPECT_EQ(d.inTheFile(kQueue), Value("old queue"));
    EXPECT_FALSE(d.preferences.get(kDaemonDomain, "CXDShareCount"));
    d.preferences.set(kDaemonDomain, kQueue, "new");
    EXPECT_THROW(d.preferences.synchronize(kDaemonDomain), CXException);
    EXPECT_FALSE(std::filesystem::exists(d.path));
    EXPECT_EQ(d.preferences.get(kDaemonDomain, kQueue), Value("new")) << "still unwritten, and not lost";
}

TEST(DaemonMemory, OfADatabaseThatWasMovedAwayNothingIsReadOrWritten) {
    Remembered d;
    d.put(kQueue, "queue");
    std::filesystem::rename(d.path, d.path + ".elsewhere");
    EXPECT_THROW((void)d.preferences.get(kDaemonDomain, kQueue), CXException);
    d.preferences.set(kDaemonDomain, kQueue, "new");
    EXPECT_THROW(d.preferences.synchronize(kDaemonDomain), CXException);
}

// -- one commit

TEST(OneCommit, WritesContactsValuesAndCursorTogether) {
    Remembered d;
    const int64_t cursor = d->cursorPosition();
    {
        auto other = d.open("rolvane");
        TestDatabase::addPersonTo(*other, "Other");
        other->save();
    }
    const CXPersonRef person = d.addPerson("Ada");
    Preferences::Hold hold(d.preferences);
    CXRolvane::OneCommit commit(*d);
    d.put(kQueue, "queue");
    d.put(kSetting, 1);
    d->save();
    d->advanceCursorTo(d->journalPosition(), Date::distantPast());
    EXPECT_FALSE(d.open("rolvane")->recordForUniqueId(person->uniqueId()));
    EXPECT_EQ(d->cursorPosition(), cursor);
    EXPECT_FALSE(d.seenByAnother(kQueue));
    EXPECT_EQ(d.seenByAnother(kSetting), Value(1)) << "no part of it";
    EXPECT_EQ(d.preferences.get(kDaemonDomain, kQueue), Value("queue"));
    commit.commit(hold.changes());
    hold.end();
    EXPECT_TRUE(d.open("rolvane")->recordForUniqueId(person->uniqueId()));
    EXPECT_GT(d->cursorPosition(), cursor);
    EXPECT_EQ(d.seenByAnother(kQueue), Value("queue"));
}

TEST(OneCommit, ThatNeverComesWritesNothingAndKeepsTheContactsUnsaved) {
    Remembered d;
    d.put(kQueue, "before");
    const CXPersonRef person = d.addPerson("Ada");
    {
        const Preferences::Hold hold(d.preferences);
        const CXRolvane::OneCommit commit(*d);
        d.put(kQueue, "after");
        d->save();
    }
    EXPECT_EQ(d.preferences.get(kDaemonDomain, kQueue), Value("before"));
    EXPECT_TRUE(d->hasUnsavedChanges());
    EXPECT_FALSE(d.open("rolvane")->recordForUniqueId(person->uniqueId()));
    d->save();
    EXPECT_TRUE(d.open("rolvane")->recordForUniqueId(person->uniqueId()));
}

TEST(OneCommit, ThatFailsWritesNothing) {
    Remembered d;
    auto impatient = d.options();
    impatient.busyTimeoutMilliseconds = 20;
    d.database.reset();
    d.database = std::make_unique<CXRolvane>(impatient);
    d.put(kQueue, "before");
    const CXPersonRef person = d.addPerson("Ada");
    {
        Preferences::Hold hold(d.preferences);
        CXRolvane::OneCommit commit(*d);
        d.put(kQueue, "after");
        d->save();
        Sqlite locked(d.path, 0);
        const SqliteTransaction writing(locked); // by somebody who does not let go
        EXPECT_THROW(commit.commit(hold.changes()), CXException);
    }
    EXPECT_EQ(d.preferences.get(kDaemonDomain, kQueue), Value("before"));
    EXPECT_TRUE(d->hasUnsavedChanges());
    EXPECT_FALSE(d.open("rolvane")->recordForUniqueId(person->uniqueId()));
}

} // namespace
} // namespace rolvane::test
