#include "TestDatabase.h"

#include "contacts/database/CXUserDefaults.h"
#include "contacts/database/ShareCountBump.h"
#include "foundation/Preferences.h"

#include <filesystem>

namespace rolvane::test {
namespace {

struct Counted : TestDatabase {
    std::string preferencesPath = directory / "state/preferences.db";

    int64_t preferred() {
        Preferences p(preferencesPath);
        return p.get(kDaemonDomain, "CXDShareCount").integer(-1);
    }
    // Steps of a bump in a process that ends right after them.
    void bumpInterruptedAfter(int steps) {
        database.reset();
        EXPECT_EQ(inProcess([&] {
                      auto daemon = open();
                      Preferences preferences(preferencesPath);
                      ShareCountBump bump(*daemon, preferences);
                      int64_t count = 0;
                      if (steps >= 1) count = bump.writeIntent();
                      if (steps >= 2) bump.writeDatabase(count);
                      if (steps >= 3) bump.clearIntent();
                      return 40 + steps;
                  }),
                  40 + steps);
        database = open();
    }
    void recover() {
        Preferences preferences(preferencesPath);
        database->recoverShareCount(preferences);
    }
    void bump() {
        Preferences preferences(preferencesPath);
        database->bumpShareCount(preferences);
    }
    bool agree() { return preferred() == database->shareCount(); }
    void copyDatabaseTo(const std::string& target) {
        database.reset(); // the last close writes everything into the one file
        std::filesystem::copy_file(path, target, std::filesystem::copy_options::overwrite_existing);
        database = open();
    }
    void restoreDatabaseFrom(const std::string& source) {
        database.reset();
        for (const char* suffix : {"-wal", "-shm"}) std::filesystem::remove(path + suffix);
        std::filesystem::copy_file(source, path, std::filesystem::copy_options::overwrite_existing);
        database = open();
    }
};

TEST(ShareCount, ChangesOnlyWhenItIsSet) {
    TestDatabase d;
    int64_t count = d->shareCount();
    d.addPerson("A");
    d->save();
    d.reopen();
    EXPECT_EQ(d->shareCount(), count);
    d->setShareCount(count + 5);
    EXPECT_EQ(d->shareCount(), count + 5);
    EXPECT_EQ(d.open("rolvane")->shareCount(), count) << "part of the unit of work";
    d->save();
    EXPECT_EQ(d.open("rolvane")->shareCount(), count + 5);
}

TEST(ShareCount, ANewDatabaseHasItsOwn) {
    TestDatabase one, two;
    EXPECT_NE(one->databaseIdentity(), two->databaseIdentity());
    EXPECT_NE(one->shareCount(), two->shareCount());
    EXPECT_GE(one->shareCount(), 0);
}

TEST(ShareCount, ABumpGoesIntoBothFilesAndLeavesNoIntent) {
    Counted d;
    int64_t before = d->shareCount();
    d.bump();
    EXPECT_EQ(d->shareCount(), before + 1);
    EXPECT_TRUE(d.agree());
    Preferences preferences(d.preferencesPath);
    EXPECT_EQ(preferences.keys(kDaemonDomain), (std::vector<std::string>{"CXDShareCount"}));
}

TEST(ShareCount, IsReadBackThroughTheUserDefaults) {
    Counted d;
    d.bump();
    Preferences preferences(d.preferencesPath);
    CXUserDefaults::usePreferences(&preferences);
    EXPECT_EQ(CXUserDefaults::rolvaneManagerPreferences().objectForKey("CXDShareCount").integer(), d->shareCount());
    EXPECT_TRUE(CXUserDefaults::rolvaneManagerPreferences().objectForKey("Nothing").isAbsent());
    CXUserDefaults::usePreferences(nullptr);
}

class InterruptedBump : public testing::TestWithParam<int> {};

TEST_P(InterruptedBump, IsCompletedOrUndoneSoThatBothFilesAgree) {
    Counted d;
    d.bump();
    d.bumpInterruptedAfter(GetParam());
    d.recover();
    EXPECT_TRUE(d.agree()) << d.preferred() << " and " << d->shareCount();
    d.reopen();
    d.recover();
    EXPECT_TRUE(d.agree()) << "and stays so";
}

TEST_P(InterruptedBump, IsCompletedAlthoughSomebodyEditedMeanwhile) {
    Counted d;
    d.bump();
    d.bumpInterruptedAfter(GetParam());
    auto app = d.open("rolvane");
    TestDatabase::addPersonTo(*app, "A");
    app->save();
    d.recover();
    EXPECT_TRUE(d.agree());
}

TEST_P(InterruptedBump, OfAnotherDatabaseIsNotTakenForThisOne) {
    Counted d;
    d.bump();
    d.bumpInterruptedAfter(GetParam());
    d.database.reset();
    std::filesystem::remove_all(d.directory / "data");
    d.database = d.open();
    d->setShareCount(d.preferred() - 1); // the worst case: the count fits by accident
    d->save();
    d.recover();
    EXPECT_FALSE(d.agree()) << "a new database must be noticed";
}

TEST_P(InterruptedBump, AnOlderCopyOfTheDatabaseIsNoticed) {
    Counted d;
    d.bump();
    std::string copy = d.directory / "copy.db";
    d.copyDatabaseTo(copy);
    d.addPerson("LostByTheRestore");
    d->save();
    d.bumpInterruptedAfter(GetParam());
    d.restoreDatabaseFrom(copy);
    // The copy goes on, further than the intent's place in the journal.
    for (int i = 0; i < 3; i++) {
        d.addPerson("Later");
        d->save();
    }
    bool alike = d.agree(); // interrupted before its first durable step, a bump says nothing
    d.recover();
    EXPECT_EQ(d.agree(), alike);
    EXPECT_EQ(alike, GetParam() == 0);
}

INSTANTIATE_TEST_SUITE_P(AfterEveryStep, InterruptedBump, testing::Values(0, 1, 2, 3));

// Ends the process at the n-th question for the time: inside the transaction of a save.
class DeadlyClock : public Clock {
public:
    explicit DeadlyClock(int n) : _left(n) {}
    Date now() const override {
        if (--_left == 0) ::_exit(50);
        return Date(1700000100);
    }

private:
    mutable int _left;
};

TEST(ShareCount, ACrashInsideTheDatabasesTransactionIsCompletedToo) {
    Counted d;
    d.bump();
    d.database.reset();
    EXPECT_EQ(inProcess([&] {
                  DeadlyClock clock(1);
                  auto options = d.options();
                  options.clock = &clock;
                  CXRolvane daemon(options);
                  Preferences preferences(d.preferencesPath);
                  daemon.bumpShareCount(preferences);
                  return 0;
              }),
              50);
    d.database = d.open();
    EXPECT_FALSE(d.agree());
    d.recover();
    EXPECT_TRUE(d.agree());
}

} // namespace
} // namespace rolvane::test
