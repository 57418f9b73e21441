#include "TestDatabase.h"

#include "contacts/database/DaemonMemory.h"
#include "foundation/Sqlite.h"

#include <csignal>
#include <filesystem>
#include <fstream>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/time.h>

namespace rolvane::test {
namespace {

TEST(DatabaseFault, AFileOfANewerFormatIsRefusedAndLeftAlone) {
    TestDatabase d;
    d.database.reset();
    Sqlite(d.path, 0).execute("PRAGMA user_version=10");
    std::string told = reasonOf([&] { d.open(); });
    EXPECT_TELLS(told, "newer version");
    EXPECT_TELLS(told, d.path);
    EXPECT_EQ(Sqlite(d.path, 0).integer("PRAGMA user_version"), 10);
}

TEST(DatabaseFault, AFileOfTheFormerFormatLearnsWhoWroteWhat) {
    TestDatabase d;
    d.addPerson("Ada", "A:CXPerson");
    d->save();
    d.database.reset();
    Sqlite(d.path, 0).execute(
        "ALTER TABLE records DROP COLUMN writer; DROP INDEX records_names; PRAGMA user_version=1");
    d.database = d.open("rolvane");
    EXPECT_EQ(d->personRow(UniqueId("A:CXPerson"))->writer, "") << "nobody knows";
    d->recordForUniqueId(UniqueId("A:CXPerson"))->setValue(Value("Adele"), kCXFirstNameProperty);
    d->save();
    EXPECT_EQ(d->personRow(UniqueId("A:CXPerson"))->writer, "rolvane");
    d.database.reset();
    EXPECT_EQ(Sqlite(d.path, 0).integer("PRAGMA user_version"), 9);
}

TEST(DatabaseFault, AFileOfTheFormatBeforeNamesItsGroupsMembers) {
    TestDatabase d;
    d.addGroup("Friends", "F:CXGroup")->addMember(d.addPerson("Ada", "A:CXPerson"));
    d->save();
    d.database.reset();
    Sqlite(d.path, 0).execute("DROP INDEX records_names; PRAGMA user_version=2");
    d.database = d.open("rolvane");
    const auto friends = std::dynamic_pointer_cast<CXGroup>(d->recordForUniqueId(UniqueId("F:CXGroup")));
    ASSERT_TRUE(friends);
    EXPECT_EQ(friends->memberUniqueIds(), std::vector{UniqueId("A:CXPerson")});
    EXPECT_EQ(friends->memberCount(), 1u);
    d.database.reset();
    EXPECT_EQ(Sqlite(d.path, 0).integer("PRAGMA user_version"), 9);
}

TEST(DatabaseFault, AFileOfTheFormatBeforeKeepsWhatEditedContactsWere) {
    TestDatabase d;
    d.addPerson("Ada", "A:CXPerson");
    d->save();
    d.database.reset();
    Sqlite(d.path, 0).execute("DROP TABLE common; DROP TABLE conflicts; PRAGMA user_version=3");
    d.database = d.open("rolvane");
    const UniqueId ada("A:CXPerson");
    EXPECT_FALSE(d->commonVersion(ada)) << "nobody knows what stores have had";
    d->setCommonVersion(ada, d->personRow(ada)->encoded);
    d->save();
    d->recordForUniqueId(ada)->setValue(Value("Adele"), kCXFirstNameProperty);
    d->save();
    EXPECT_EQ(d->editedSinceCommon(), std::vector{ada});
    d.database.reset();
    EXPECT_EQ(Sqlite(d.path, 0).integer("PRAGMA user_version"), 9);
}

TEST(DatabaseFault, AFileOfTheFormatBeforeFindsPeopleByTheirNames) {
    TestDatabase d;
    d.addPerson("Ada", "A:CXPerson");
    d->save();
    d.database.reset();
    Sqlite(d.path, 0).execute("DROP INDEX records_display; PRAGMA user_version=4");
    d.database = d.open("rolvane");
    for (const auto& [named, how] :
         std::vector<std::pair<std::string, CXRolvane::Named>>{{"ADA", CXRolvane::Named::whole},
                                                               {"d", CXRolvane::Named::part},
                                                               {"a:cx", CXRolvane::Named::byIdentifier}}) {
        const auto found = d->peopleNamed(named, how);
        ASSERT_EQ(found.size(), 1u) << named;
        EXPECT_EQ(found[0].uniqueId.str(), "A:CXPerson");
        EXPECT_EQ(found[0].displayName, "Ada");
        d.addPerson("Bob"); // what is not saved is found, too
        EXPECT_EQ(d->peopleNamed("bob", CXRolvane::Named::whole).size(), 1u);
        d->rollback();
    }
    d.database.reset();
    EXPECT_EQ(Sqlite(d.path, 0).integer("PRAGMA user_version"), 9);
}

TEST(DatabaseFault, AFileOfTheFormatBeforeKeepsTheDaemonsMemory) {
    TestDatabase d;
    d.database.reset();
    Sqlite(d.path, 0).execute("DROP TABLE daemon; "
                              "CREATE TABLE daemon(key TEXT PRIMARY KEY, value BLOB NOT NULL) WITHOUT ROWID; "
                              "INSERT INTO daemon VALUES('CXDShareCount', x'01'), ('CXDConduitData', x'02'); "
                              "PRAGMA user_version=8");
    d.database = d.open("rolvane");
    Sqlite file(d.path, 0);
    MemoryTable memory(file);
    EXPECT_EQ(memory.keys(), (std::vector<std::string>{"CXDConduitData", "CXDShareCount"}));
    EXPECT_EQ(memory.value("CXDShareCount"), Bytes{1});
    EXPECT_EQ(memory.value("CXDConduitData"), Bytes{2});
    memory.write({{"CXDShareCount", Bytes{3}}, {"CXDConduitData", std::nullopt}});
    EXPECT_EQ(memory.value("CXDShareCount"), Bytes{3});
    EXPECT_EQ(memory.keys(), std::vector<std::string>{"CXDShareCount"});
    EXPECT_EQ(file.integer("PRAGMA user_version"), 9);
}

TEST(DatabaseFault, AnotherProgramsFileIsRefusedAndLeftAlone) {
    TestDatabase d;
    std::string other = d.directory / "other.db";
    Sqlite(other, 0).execute("CREATE TABLE t(x); INSERT INTO t VALUES(7)");
    d.path = other;
    EXPECT_TELLS(reasonOf([&] { d.open(); }), "no contact database");
    EXPECT_EQ(Sqlite(other, 0).integer("SELECT x FROM t"), 7);
}

TEST(DatabaseFault, ADamagedFileIsNamedAndLeftAlone) {
    TestDatabase d;
    d.addPerson("A");
    d->save();
    d.database.reset();
    std::ofstream(d.path, std::ios::in | std::ios::out | std::ios::binary) << "this was a database once";
    auto size = std::filesystem::file_size(d.path);
    std::string told = reasonOf([&] { d.open(); });
    EXPECT_TELLS(told, "damaged");
    EXPECT_TELLS(told, d.path);
    EXPECT_TELLS(told, "backup");
    EXPECT_EQ(std::filesystem::file_size(d.path), size);
}

TEST(DatabaseFault, DamageInTheMiddleIsToldWhenItIsMet) {
    TestDatabase d;
    for (int i = 0; i < 2000; i++) d.addPerson("A");
    d->save();
    d.database.reset();
    std::fstream file(d.path, std::ios::in | std::ios::out | std::ios::binary);
    for (size_t at = 8192; at < std::filesystem::file_size(d.path); at += 4096) {
        file.seekp(static_cast<std::streamoff>(at));
        file << "damage damage damage";
    }
    file.close();
    std::string told = reasonOf([&] {
        auto database = d.open();
        database->listPeople(std::nullopt);
        database->forEachPersonModifiedSince(Date::distantPast(), kCXPersonTable, [](const CXRow&) {});
    });
    EXPECT_TELLS(told, "damaged");
}

TEST(DatabaseFault, ALockedDatabaseKeepsTheUnsavedChangesForAnotherTry) {
    TestDatabase d;
    auto options = d.options();
    options.busyTimeoutMilliseconds = 20;
    d.database = std::make_unique<CXRolvane>(options);
    d.addPerson("A");
    {
        Sqlite other(d.path, 0);
        SqliteTransaction holding(other);
        EXPECT_TELLS(reasonOf([&] { d->save(); }), "locked");
        EXPECT_TRUE(d->hasUnsavedChanges());
        EXPECT_EQ(d->countPeople(std::nullopt), 1u);
    }
    EXPECT_TRUE(d->save());
    EXPECT_EQ(d.open("rolvane")->countPeople(std::nullopt), 1u);
}

TEST(DatabaseFault, AFullDiskLosesNothing) {
    TestDatabase d;
    d.addPerson("A");
    d->save();
    d.database.reset();
    EXPECT_EQ(inProcess([&] {
                  auto database = d.open();
                  ::signal(SIGXFSZ, SIG_IGN);
                  rlimit former{}, tight{};
                  ::getrlimit(RLIMIT_FSIZE, &former);
                  tight = {200000, former.rlim_max};
                  ::setrlimit(RLIMIT_FSIZE, &tight);
                  CXPersonRef big = TestDatabase::addPersonTo(*database, "Big");
                  big->setValue(Bytes(500000, 1), kCXPhotoProperty);
                  std::string told = reasonOf([&] { database->save(); });
                  if (told.find("Could not write to") != 0) return 1;
                  if (told.find("no room is left") == std::string::npos) return 4;
                  if (!database->hasUnsavedChanges() || database->countPeople(std::nullopt) != 2) return 2;
                  ::setrlimit(RLIMIT_FSIZE, &former);
                  return database->save() && !database->hasUnsavedChanges() ? 0 : 3;
              }),
              0);
    EXPECT_EQ(d.open()->countPeople(std::nullopt), 2u);
}

TEST(DatabaseFault, AReadOnlyDatabaseCanBeReadAndSaysWhyItCannotBeWritten) {
    TestDatabase d;
    d.addPerson("A");
    d->save();
    // Held open here, so that the log's files exist for the reader.
    for (const char* suffix : {"", "-wal", "-shm"}) ::chmod((d.path + suffix).c_str(), 0444);
    ::chmod((d.directory / "data").c_str(), 0555);
    ::chmod(d.directory.path().c_str(), 0755);
    EXPECT_EQ(inProcess([&] {
                  if (::geteuid() == 0 && (::setegid(65534) != 0 || ::seteuid(65534) != 0)) return 1;
                  auto database = d.open("rolvane");
                  if (database->countPeople(std::nullopt) != 1) return 2;
                  TestDatabase::addPersonTo(*database, "B");
                  std::string told = reasonOf([&] { database->save(); });
                  if (told.find("cannot be written") == std::string::npos) return 3;
                  if (told.find("permissions") == std::string::npos) return 4;
                  return database->hasUnsavedChanges() ? 0 : 5;
              }),
              0);
    ::chmod((d.directory / "data").c_str(), 0700);
    for (const char* suffix : {"", "-wal", "-shm"}) ::chmod((d.path + suffix).c_str(), 0600);
}

TEST(DatabaseFault, AFileThatWasReplacedIsWrittenNoMoreAndItsSuccessorIsLeftAlone) {
    TestDatabase d;
    d.addPerson("Ada");
    d->save();
    for (const char* part : {"", "-wal", "-shm"}) std::filesystem::rename(d.path + part, d.path + ".former" + part);
    const auto successor = d.open("rolvane");
    TestDatabase::addPersonTo(*successor, "Grace", "G:CXPerson");
    successor->save();

    d.addPerson("Eve");
    for (const std::string& told : {reasonOf([&] { d->save(); }), reasonOf([&] { d->deliverExternalChanges(); })}) {
        EXPECT_TELLS(told, "replaced");
        EXPECT_TELLS(told, d.path);
    }
    d.database.reset();
    EXPECT_TRUE(d.open("third")->recordForUniqueId(UniqueId("G:CXPerson"))) << "its log was taken away";
}

TEST(DatabaseFault, ADirectoryInThePlaceOfTheFileIsToldClearly) {
    TestDatabase d;
    std::filesystem::create_directory(d.directory / "here.db");
    d.path = d.directory / "here.db";
    std::string told = reasonOf([&] { d.open(); });
    EXPECT_TELLS(told, "here.db");
    EXPECT_TELLS(told, "cannot be opened");
}

TEST(DatabaseFault, ManyProcessesMakeOneDatabaseTogether) {
    TempDirectory directory;
    std::vector<pid_t> children;
    for (int i = 0; i < 8; i++) {
        pid_t child = ::fork();
        if (child == 0) {
            int result = 1;
            try {
                CXRolvane::Options options;
                options.path = directory / "new/contacts.db";
                options.program = "p" + std::to_string(i);
                CXRolvane database(options);
                TestDatabase::addPersonTo(database, "P");
                database.save();
                result = 0;
            } catch (const std::exception& e) {
                (void)!::write(2, e.what(), std::char_traits<char>::length(e.what()));
            }
            ::_exit(result);
        }
        children.push_back(child);
    }
    for (pid_t child : children) {
        int status = 0;
        ::waitpid(child, &status, 0);
        EXPECT_EQ(status, 0);
    }
    CXRolvane::Options options;
    options.path = directory / "new/contacts.db";
    CXRolvane database(options);
    EXPECT_EQ(database.countPeople(std::nullopt), 8u);
    EXPECT_EQ(database.subscriptions().size(), 1u);
}

// A process saves three people at a time until it is killed; whatever the moment, no save is there in part.
TEST(DatabaseFault, AKillAtAnyMomentOfASaveLeavesWholeSavesOnly) {
    for (int attempt = 0; attempt < 20; attempt++) {
        TestDatabase d;
        d->cursorPosition(); // keeps the journal
        int64_t start = d->journalPosition();
        d.database.reset();
        EXPECT_EQ(inProcess([&] {
                      itimerval after{{0, 0}, {0, 20000 + attempt * 1700}};
                      auto database = d.open("rolvane");
                      ::setitimer(ITIMER_REAL, &after, nullptr); // SIGALRM ends the process on the spot
                      for (int i = 0;; i++) {
                          CXGroupRef group = CXGroup::create();
                          database->addRecord(group);
                          for (int k = 0; k < 3; k++)
                              group->addMember(TestDatabase::addPersonTo(*database, std::to_string(i)));
                          database->save();
                      }
                      return 0;
                  }),
                  128 + SIGALRM);
        d.database = d.open();
        std::map<std::string, int> saved;
        for (const CXListing& l : d->listPeople(std::nullopt)) saved[l.displayName]++;
        for (const auto& [save, people] : saved) EXPECT_EQ(people, 3) << "of save " << save;
        EXPECT_EQ(d->allGroup()->subgroups().size(), saved.size());
        for (const auto& group : d->allGroup()->subgroups()) EXPECT_EQ(group->memberCount(), 3u);
        EXPECT_EQ(d->journalEntries(start, 100000).size(), saved.size() * 4) << "each with its journal";
        d.addPerson("after");
        EXPECT_TRUE(d->save()) << "nobody is locked out";
    }
}

} // namespace
} // namespace rolvane::test
