// Files that say two things at once: what an index does not know and a row says is there is nobody's deletion.

#include "DamagedIndex.h"
#include "TestDatabase.h"

#include "contacts/database/DamagedDatabase.h"
#include "foundation/Preferences.h"
#include "foundation/Sqlite.h"

#include <filesystem>

namespace rolvane::test {
namespace {

// Ada, Ben, Cleo and Dora; Ada and Cleo are friends.
struct DamagedDatabase : TestDatabase {
    DamagedDatabase() {
        const auto friends = addGroup("Friends", "F:CXGroup");
        for (const char* name : {"Ada", "Ben", "Cleo", "Dora"}) {
            const auto person = addPerson(name, std::string(name) + ":CXPerson");
            if (*name != 'B' && *name != 'D') friends->addMember(person);
        }
        (*this)->save();
    }
    void alone(const std::string& index, const std::string& change) {
        database.reset();
        changeWithout(path, index, change);
    }
    void reopenDatabase() { database = open(); }
    std::vector<std::string> everybody() {
        std::vector<std::string> members;
        for (const UniqueId& uid : database->allGroup()->memberUniqueIds()) members.push_back(uid.str());
        std::sort(members.begin(), members.end());
        return members;
    }
    CXGroupRef group(const std::string& uid) {
        return std::dynamic_pointer_cast<CXGroup>(database->recordForUniqueId(UniqueId(uid)));
    }
    const std::vector<std::string> all{"Ada:CXPerson", "Ben:CXPerson", "Cleo:CXPerson", "Dora:CXPerson"};
};

void loseBenInTheIndex(DamagedDatabase& d) {
    d.database.reset();
    loseInTheIndex(d.path, "Ben:CXPerson");
    d.reopenDatabase();
}

TEST(Damage, WhatAnIndexHasLostIsNotTakenForGone) {
    DamagedDatabase d;
    loseBenInTheIndex(d);
    ASSERT_EQ(d.everybody(), (std::vector<std::string>{"Ada:CXPerson", "Cleo:CXPerson", "Dora:CXPerson"}));
    EXPECT_EQ(damageOf(*d), "");
    AbsenceCheck check(*d);
    EXPECT_EQ(reasonOf([&] { check.requireGoneFrom("", UniqueId("Eve:CXPerson")); }), "");
    EXPECT_EQ(reasonOf([&] { check.requireGoneFrom("elsewhere", UniqueId("Ben:CXPerson")); }), "");
    const std::string told = reasonOf([&] { check.requireGoneFrom("", UniqueId("Ben:CXPerson")); });
    EXPECT_TELLS(told, "damaged");
    EXPECT_TELLS(told, d.path);
    EXPECT_EQ(damageOf(*d), told);
    EXPECT_NE(reasonOf([&] { check.requireGone(UniqueId("Ben:CXPerson")); }), "");

    repairDatabase(*d);
    EXPECT_EQ(damageOf(*d), "");
    EXPECT_EQ(d.everybody(), d.all);
}

TEST(Damage, WhatIsRemovedInTheUnitOfWorkIsGone) {
    DamagedDatabase d;
    d->removeRecord(d->recordForUniqueId(UniqueId("Ben:CXPerson")));
    AbsenceCheck check(*d);
    EXPECT_EQ(reasonOf([&] { check.requireGone(UniqueId("Ben:CXPerson")); }), "");
    EXPECT_EQ(reasonOf([&] { check.requireGoneFrom("", UniqueId("Ben:CXPerson")); }), "");
    d->save();
    AbsenceCheck later(*d);
    EXPECT_EQ(reasonOf([&] { later.requireGone(UniqueId("Ben:CXPerson")); }), "");
}

TEST(Damage, AMemberWhomAnIndexDoesNotNameIsStillListed) {
    DamagedDatabase d;
    d.alone("records_names", "UPDATE records SET uid='X:CXPerson' WHERE uid='Ada:CXPerson'");
    d.alone("records_names", "SELECT 1");
    d.database.reset();
    { // The index names Ada as before, the rows another; the other way round for the test.
        Sqlite file(d.path, 1000);
        file.execute("REINDEX");
    }
    d.alone("records_names", "UPDATE records SET uid='Ada:CXPerson' WHERE uid='X:CXPerson'");
    d.reopenDatabase();
    ASSERT_EQ(texts(d.group("F:CXGroup")->memberUniqueIds()),
              (std::vector<std::string>{"X:CXPerson", "Cleo:CXPerson"}));
    AbsenceCheck check(*d);
    EXPECT_EQ(reasonOf([&] { check.requireUnlisted(UniqueId("F:CXGroup"), {UniqueId("Ben:CXPerson")}); }), "");
    EXPECT_TELLS(reasonOf([&] { check.requireUnlisted(UniqueId("F:CXGroup"), {UniqueId("Ada:CXPerson")}); }),
                 "damaged");
    repairDatabase(*d);
    EXPECT_EQ(texts(d.group("F:CXGroup")->memberUniqueIds()),
              (std::vector<std::string>{"Ada:CXPerson", "Cleo:CXPerson"}));
}

TEST(Damage, RowsThatCannotBeBelievedAreNotMadeTheTruthByARepair) {
    const auto refuses = [](const std::function<void(DamagedDatabase&)>& damage, const std::string& why) {
        DamagedDatabase d;
        damage(d);
        d.reopenDatabase();
        SCOPED_TRACE(why);
        const std::string told = reasonOf([&] { repairDatabase(*d); });
        EXPECT_TELLS(told, why);
        EXPECT_TELLS(told, "backup");
        EXPECT_TELLS(told, "rolvane new-database");
    };
    refuses(
        [](DamagedDatabase& d) {
            d.database.reset();
            Sqlite(d.path, 1000).execute("UPDATE records SET kind=9 WHERE uid='Ben:CXPerson'");
        },
        "another kind");
    refuses(
        [](DamagedDatabase& d) {
            d.database.reset();
            Sqlite(d.path, 1000).execute("UPDATE records SET location='x' WHERE uid='Ben:CXPerson'");
        },
        "two locations");
    refuses(
        [](DamagedDatabase& d) {
            d.database.reset();
            Sqlite(d.path, 1000).execute("UPDATE records SET properties=x'00' WHERE uid='Ben:CXPerson'");
        },
        "cannot be read");
    // The lists have lost what their index still has.
    refuses([](DamagedDatabase& d) { d.alone("listed_member", "DELETE FROM listed"); }, "not certain");
}

TEST(Damage, AFileOfNoBytesIsNobodysBeginning) {
    TestDatabase d;
    d.database.reset();
    std::filesystem::resize_file(d.path, 0);
    for (const char* suffix : {"-wal", "-shm"}) std::filesystem::remove(d.path + suffix);
    const std::string told = reasonOf([&] { d.open(); });
    EXPECT_TELLS(told, "0 bytes");
    EXPECT_TELLS(told, d.path);
    EXPECT_TELLS(told, "backup");
    EXPECT_EQ(std::filesystem::file_size(d.path), 0u);
    beginNewDatabase(d.path);
    EXPECT_EQ(d.open()->countPeople(std::nullopt), 0u);
    EXPECT_TRUE(std::filesystem::exists(d.path + ".empty"));
    EXPECT_TELLS(reasonOf([&] { beginNewDatabase(d.path); }), "Move it away");
}

TEST(Damage, AFileThatIsGoneThoughSomethingOfItIsSharedIsToldAndNotMadeAnew) {
    TestDatabase d;
    Preferences preferences(d.directory / "preferences.db");
    EXPECT_EQ(reasonOf([&] { requireKnownDatabase(d.path, preferences); }), "");
    d.database.reset();
    for (const char* suffix : {"", "-wal", "-shm"}) std::filesystem::remove(d.path + suffix);
    EXPECT_EQ(reasonOf([&] { requireKnownDatabase(d.path, preferences); }), "") << "nothing was ever shared";
    preferences.set(kDaemonDomain, "CXDShareCount", 7);
    const std::string told = reasonOf([&] { requireKnownDatabase(d.path, preferences); });
    EXPECT_TELLS(told, "is gone");
    EXPECT_TELLS(told, "rolvane new-database");
    EXPECT_FALSE(std::filesystem::exists(d.path));
    beginNewDatabase(d.path);
    EXPECT_EQ(reasonOf([&] { requireKnownDatabase(d.path, preferences); }), "");
}

TEST(Damage, ANewFileIsThereAsAWholeOrNotAtAll) {
    TestDatabase d;
    size_t files = 0;
    for (const auto& entry : std::filesystem::directory_iterator(d.directory / "data"))
        files += entry.path().string().find(".new.") != std::string::npos;
    EXPECT_EQ(files, 0u) << "nothing of its making is left";
}

} // namespace
} // namespace rolvane::test
