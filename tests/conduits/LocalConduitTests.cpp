#include "conduits/local/CXDLocalConduit.h"

#include "DaemonDatabase.h"
#include "FakeEngine.h"
#include "TestRecord.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/database/DaemonMemory.h"
#include "contacts/records/Constants.h"
#include "foundation/Paths.h"
#include "foundation/Preferences.h"
#include "foundation/PropertyList.h"
#include "support/CapturingLog.h"
#include "support/TempHome.h"

#include <cstring>
#include <filesystem>
#include <fstream>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

using namespace rolvane;
using namespace rolvane::test;
namespace fs = std::filesystem;

namespace {

class LocalConduit : public testing::Test {
protected:
    LocalConduit() {
        fs::create_directory(root);
        conduit = make();
    }
    std::unique_ptr<CXDLocalConduit> make() {
        return std::make_unique<CXDLocalConduit>(
            engine, CXDLocalConduit::Collaborators{database, preferences, clock, UserName("ada"), root});
    }
    static CXDChangeRecordPtr record(int type, const char* person, const char* group, Value payload = {},
                                     const char* user = "<self>") {
        return testRecord(CXDSyncSourceCX, type, person, group, std::move(payload), user);
    }
    bool apply(int type, const char* person, const char* group, Value payload = {}, const char* user = "<self>") {
        return conduit->applyChangeRecord(record(type, person, group, std::move(payload), user));
    }
    std::string at(const std::string& relative) const { return root + "/ada/" + relative; }
    Value plist(const std::string& relative) const { return PropertyList::fromXML(readFile(at(relative))); }
    mode_t modeAt(const std::string& relative) const {
        struct stat status {};
        return ::lstat(at(relative).c_str(), &status) == 0 ? status.st_mode & 07777 : 0;
    }
    // Every file and directory below the root.
    Texts tree() const {
        Texts all;
        for (const auto& entry : fs::recursive_directory_iterator(root))
            all.push_back(fs::relative(entry.path(), root).string());
        std::sort(all.begin(), all.end());
        return all;
    }

    TempDirectory directory;
    const std::string root = directory / "shared";
    FakeEngine engine;
    ManualClock clock{Date(1'800'000'000)};
    Preferences preferences{directory / "preferences.db", daemonMemory(directory / "contacts.db")};
    NotificationCenter center;
    CXRolvane database{daemonDatabase(directory, clock, center)};
    CapturingLog log;
    std::unique_ptr<CXDLocalConduit> conduit;
};

} // namespace

// -- who and where

TEST_F(LocalConduit, IsTheSharedFoldersSource) {
    EXPECT_EQ(conduit->conduitID(), "CXDLocal");
    EXPECT_EQ(conduit->conduitSource(), 2);
    EXPECT_EQ(conduit->realUserFromUser(kSelf), UserName("ada"));
    EXPECT_EQ(conduit->realUserFromUser(UserName("bob")), UserName("bob"));
    EXPECT_EQ(conduit->realUserFromUser(std::nullopt), std::nullopt);
}

TEST_F(LocalConduit, IsMeantForTheFolderThatAllUsersShare) {
    const CXDLocalConduit usual(engine, CXDLocalConduit::Collaborators{database, preferences, clock, UserName("ada")});
    EXPECT_EQ(usual.lockPath(), "/usr/share/rolvane/.lock");
    EXPECT_EQ(usual.baseLocationForUser(UserName("bob"))->absoluteString(), "file:/usr/share/rolvane/bob");
    const CXDLocalConduit another(engine,
                                  CXDLocalConduit::Collaborators{database, preferences, clock, UserName("eve")});
    EXPECT_EQ(usual.defaultManager(), another.defaultManager()) << "one file manager serves the process";
    EXPECT_EQ(conduit->lockPath(), root + "/.lock");
}

TEST_F(LocalConduit, ABaseLocationLeadsBackToItsUser) {
    const auto base = conduit->baseLocationForUser(UserName("jean luc"));
    EXPECT_EQ(base->absoluteString(), "file:" + root + "/jean%20luc");
    EXPECT_EQ(base->filePath(), root + "/jean luc");
    EXPECT_EQ(conduit->baseLocationForUser(std::nullopt), std::nullopt);
    for (const char* hostile : {"", ".", "..", "a/b", "../bob", ".lock"})
        EXPECT_EQ(conduit->baseLocationForUser(UserName(hostile)), std::nullopt) << hostile;
}

// The file of a contact and the location that the base names for it differ; both stay as they are.
TEST_F(LocalConduit, WritesAContactBesideTheLocationThatTheBaseNames) {
    apply(CXDUpdateRecord, "abc", nullptr, Dictionary{{"First", "Ada"}});
    EXPECT_TRUE(fs::exists(at("People/abc")));
    EXPECT_EQ(conduit->locationForUID(UniqueId("abc"), kSelf)->filePath(), at("People/16/abc"));
}

// -- the frame of a pass

TEST_F(LocalConduit, OpeningLocksTheWholeFolderAndReadsTheLastSyncDate) {
    conduit->open();
    EXPECT_EQ(engine.takeCalls(), Texts{"lock file:" + root + "/.lock"});
    EXPECT_EQ(conduit->lastSyncDate(), Date::distantPast());
    preferences.set(kDaemonDomain, "CXDLocalConduitLastSyncDate", Date(1'700'000'000));
    conduit->open();
    EXPECT_EQ(conduit->lastSyncDate(), Date(1'700'000'000));
}

TEST_F(LocalConduit, OpensWithoutTheLockWhenSomebodyElseHoldsIt) {
    engine.locks = false;
    preferences.set(kDaemonDomain, "CXDLocalConduitLastSyncDate", Date(1'700'000'000));
    conduit->open();
    EXPECT_EQ(conduit->lastSyncDate(), Date(1'700'000'000));
    EXPECT_TRUE(apply(CXDUpdateRecord, "P", nullptr, Dictionary()));
}

TEST_F(LocalConduit, ClosingForgetsRevokedUsersAndKeepsTheDateForTheNextRun) {
    conduit->open();
    engine.account = UserName("ada");
    engine.priorState("CXDLocal").set("bob", Dictionary());
    engine.priorState("CXDLocal").set("eve", Dictionary());
    engine.revoked = {RemoteLocation("http://store/bob/Contacts")};
    conduit->close();
    EXPECT_EQ(engine.priorState("CXDLocal").allKeys(), Texts{"eve"});
    EXPECT_EQ(conduit->lastSyncDate(), clock.now());
    EXPECT_EQ(Preferences(directory / "preferences.db", daemonMemory(directory / "contacts.db"))
                  .get(kDaemonDomain, "CXDLocalConduitLastSyncDate"),
              Value(clock.now()))
        << "synchronised at once";
    clock.advance(60);
    const auto next = make();
    next->open();
    EXPECT_EQ(next->lastSyncDate(), Date(1'800'000'000));
}

// -- contacts

TEST_F(LocalConduit, WritesAContactDirectlyInPeopleForEverybodyToReplace) {
    const mode_t former = ::umask(077);
    EXPECT_TRUE(apply(CXDUpdateRecord, "P:CXPerson", nullptr, Dictionary{{"First", "Ada"}}));
    ::umask(former);
    EXPECT_EQ(plist("People/P:CXPerson"), Value(Dictionary{{"First", "Ada"}}));
    EXPECT_EQ(tree(), (Texts{"ada", "ada/People", "ada/People/P:CXPerson"}));
    for (const char* path : {"", "People", "People/P:CXPerson"}) EXPECT_EQ(modeAt(path), 0777u) << path;
}

TEST_F(LocalConduit, ReplacesAContactWhole) {
    apply(CXDUpdateRecord, "P", nullptr, Dictionary{{"First", "a long and winding name"}, {"Last", "Q"}});
    apply(CXDUpdateRecord, "P", nullptr, Dictionary{{"First", "Bo"}});
    EXPECT_EQ(plist("People/P"), Value(Dictionary{{"First", "Bo"}}));
}

TEST_F(LocalConduit, WritesIntoTheDirectoryOfTheRecordsUser) {
    EXPECT_TRUE(apply(CXDUpdateRecord, "P", nullptr, Dictionary(), "bob"));
    EXPECT_EQ(tree(), (Texts{"bob", "bob/People", "bob/People/P"}));
}

TEST_F(LocalConduit, AContactThatCannotBeWrittenIsLoggedAndCountsAsApplied) {
    fs::create_directories(at("People/P"));
    EXPECT_TRUE(apply(CXDUpdateRecord, "P", nullptr, Dictionary()));
    EXPECT_EQ(log.lines(), Texts{std::string("ERR: ") + std::strerror(EISDIR)});
}

TEST_F(LocalConduit, ADeletedContactStaysAndTheChangeFailsEachTime) {
    apply(CXDUpdateRecord, "P", nullptr, Dictionary());
    EXPECT_FALSE(apply(CXDDeleteRecord, "P", nullptr));
    EXPECT_FALSE(apply(CXDDeleteRecord, "P", nullptr));
    EXPECT_TRUE(fs::exists(at("People/P")));
}

// -- groups

TEST_F(LocalConduit, MakesAGroupsStructureWithItsInfo) {
    EXPECT_TRUE(apply(CXDCreateStructureForGroup, nullptr, "G:CXGroup", Dictionary{{kCXGroupNameProperty, "Friends"}}));
    EXPECT_EQ(plist("G:CXGroup/info"), Value(Dictionary{{kCXGroupNameProperty, "Friends"}}));
    EXPECT_EQ(tree(), (Texts{"ada", "ada/G:CXGroup", "ada/G:CXGroup/info", "ada/People"}));
    for (const char* path : {"People", "G:CXGroup", "G:CXGroup/info"}) EXPECT_EQ(modeAt(path), 0777u) << path;
}

TEST_F(LocalConduit, MarksAMemberInTheGroupsDirectoryAndTakesTheMarkAway) {
    EXPECT_TRUE(apply(CXDAddRecordToGroup, "P", "G"));
    EXPECT_EQ(readFile(at("G/P")), "Distribution Lists Go Here");
    EXPECT_EQ(modeAt("G/P"), 0777u);
    EXPECT_TRUE(fs::is_directory(at("People")));
    EXPECT_TRUE(apply(CXDRemoveRecordFromGroup, "P", "G"));
    EXPECT_FALSE(fs::exists(at("G/P")));
    EXPECT_TRUE(apply(CXDRemoveRecordFromGroup, "P", "G")) << "nothing to take away";
    EXPECT_TRUE(apply(CXDRemoveRecordFromGroup, "P", "nowhere"));
}

TEST_F(LocalConduit, RenamingAGroupKeepsTheOtherEntriesOfItsInfo) {
    apply(CXDCreateStructureForGroup, nullptr, "G", Dictionary{{kCXGroupNameProperty, "Old"}, {"Colour", "red"}});
    EXPECT_TRUE(apply(CXDChangeGroupName, nullptr, "G", "New"));
    EXPECT_EQ(plist("G/info"), Value(Dictionary{{kCXGroupNameProperty, "New"}, {"Colour", "red"}}));
}

TEST_F(LocalConduit, RenamingAGroupWithoutInfoWritesNothingAndSucceeds) {
    EXPECT_TRUE(apply(CXDChangeGroupName, nullptr, "G", "New"));
    EXPECT_EQ(tree(), Texts{});
    fs::create_directories(at("G"));
    std::ofstream(at("G/info")) << "no property list";
    EXPECT_TRUE(apply(CXDChangeGroupName, nullptr, "G", "New"));
    EXPECT_EQ(readFile(at("G/info")), "no property list");
}

TEST_F(LocalConduit, ACompositeChangeKeepsTheMembersAsKeys) {
    apply(CXDCreateStructureForGroup, nullptr, "G", Dictionary());
    EXPECT_TRUE(apply(CXDCompositeGroupChange, nullptr, "G",
                      Dictionary{{"adds", Array{"a", "b", "b"}}, {kCXGroupNameProperty, "Friends"}}));
    EXPECT_TRUE(
        apply(CXDCompositeGroupChange, nullptr, "G", Dictionary{{"adds", Array{"c"}}, {"removes", Array{"a"}}}));
    const Dictionary expected{{"uidState", Dictionary{{"b", Dictionary()}, {"c", Dictionary()}}},
                              {kCXGroupNameProperty, "Friends"}};
    EXPECT_EQ(conduit->defaultManager()->dictionaryAtURL(Url::fileURL(at("G")), nullptr, false), expected);
}

TEST_F(LocalConduit, AMemberThatIsAKeyAlreadyKeepsItsValue) {
    fs::create_directories(at(""));
    std::ofstream(at("G")) << PropertyList::toXML(
        Dictionary{{"uidState", Dictionary{{"a", Dictionary{{"since", 7}}}}}, {"other", "kept"}});
    EXPECT_TRUE(apply(CXDCompositeGroupChange, nullptr, "G", Dictionary{{"adds", Array{"a", "b"}}}));
    EXPECT_EQ(plist("G"),
              Value(Dictionary{{"uidState", Dictionary{{"a", Dictionary{{"since", 7}}}, {"b", Dictionary()}}},
                               {"other", "kept"}}));
}

TEST_F(LocalConduit, AMissingStateCountsAsEmpty) {
    fs::create_directories(at(""));
    EXPECT_TRUE(apply(CXDCompositeGroupChange, nullptr, "G", Dictionary{{"adds", Array{"a"}}}));
    EXPECT_EQ(plist("G"), Value(Dictionary{{"uidState", Dictionary{{"a", Dictionary()}}}}));
}

// A group's state may come before its structure: the state then moves into the directory and both stay readable.
TEST_F(LocalConduit, AStateInTheWayOfTheStructureMovesIntoIt) {
    fs::create_directories(at(""));
    apply(CXDCompositeGroupChange, nullptr, "G", Dictionary{{"adds", Array{"a"}}});
    EXPECT_TRUE(apply(CXDCreateStructureForGroup, nullptr, "G", Dictionary{{kCXGroupNameProperty, "Friends"}}));
    EXPECT_EQ(plist("G/info"), Value(Dictionary{{kCXGroupNameProperty, "Friends"}}));
    const auto state = conduit->defaultManager()->dictionaryAtURL(Url::fileURL(at("G")), nullptr, false);
    EXPECT_EQ(state.value_or(Dictionary()), (Dictionary{{"uidState", Dictionary{{"a", Dictionary()}}}}));
}

TEST_F(LocalConduit, DeletingAGroupRemovesItsDirectoryWithItsContents) {
    apply(CXDCreateStructureForGroup, nullptr, "G", Dictionary());
    apply(CXDAddRecordToGroup, "P", "G");
    EXPECT_TRUE(apply(CXDDeleteGroup, nullptr, "G"));
    EXPECT_EQ(tree(), (Texts{"ada", "ada/People"}));
    EXPECT_TRUE(apply(CXDDeleteGroup, nullptr, "G")) << "a group that is gone already";
}

TEST_F(LocalConduit, TellsWhenAGroupCannotBeRemoved) {
    std::ofstream(root + "/ada") << "a file where the user's directory should be";
    fs::create_directory_symlink(directory.path(), root + "/bob");
    EXPECT_FALSE(apply(CXDDeleteGroup, nullptr, "preferences.db", {}, "bob")) << "behind a link";
    EXPECT_FALSE(apply(CXDDeleteGroup, nullptr, nullptr));
}

TEST_F(LocalConduit, AccessListChangesSucceedWithoutTouchingTheDisk) {
    const Dictionary differences{{"additions", Array{"bob"}}, {"deletions", Array{}}};
    EXPECT_TRUE(apply(CXDChangeGroupReadACL, nullptr, "AllCXGroup", differences));
    EXPECT_TRUE(apply(CXDChangeGroupReadWriteACL, nullptr, "AllCXGroup", differences));
    EXPECT_EQ(tree(), Texts{});
    EXPECT_EQ(conduit->ACLManagerForRemoteLocation(*conduit->baseLocationForUser(kSelf)), nullptr);
}

TEST_F(LocalConduit, TypesThatAreNotTheFoldersBusinessFail) {
    for (const int type : {6, 9, 257, 259, 260, 0, 10}) EXPECT_FALSE(apply(type, "P", "G", Dictionary())) << type;
    EXPECT_EQ(tree(), Texts{});
}

TEST_F(LocalConduit, NeverSaysThatAChangeWasDenied) {
    for (const int type : {1, 2, 3, 4, 5, 7, 8, 258, 260, 261}) {
        bool denied = false;
        conduit->applyChangeRecord(record(type, "P", "G", Dictionary()), &denied);
        EXPECT_FALSE(denied) << type;
        denied = true;
        conduit->applyChangeRecord(record(type, "P", "G", Dictionary()), &denied);
        EXPECT_TRUE(denied) << "the flag is not touched: " << type;
    }
}

TEST_F(LocalConduit, PublishingAllLeavesAMarkForEverybody) {
    EXPECT_TRUE(conduit->publishAllGroup(*record(CXDUpdateRecord, nullptr, nullptr)));
    EXPECT_TRUE(fs::is_directory(at("PublishAll")));
    EXPECT_EQ(modeAt("PublishAll"), 0777u);
    EXPECT_TRUE(conduit->publishAllGroup(*record(CXDUpdateRecord, nullptr, nullptr)));
}

// -- what others may have put there

TEST_F(LocalConduit, NamesThatLeadElsewhereTouchNothing) {
    std::ofstream(directory / "victim") << "mine";
    for (const char* name : {"../../victim", "..", ".", "a/b", "info", "People", "dateFile", ".state"})
        for (const int type : {1, 2, 3, 4, 5, 258, 261}) EXPECT_FALSE(apply(type, name, name, Dictionary())) << name;
    for (const char* user : {"..", "", "a/../..", ".lock"}) {
        EXPECT_FALSE(apply(CXDUpdateRecord, "P", "G", Dictionary(), user)) << user;
        EXPECT_FALSE(conduit->publishAllGroup(*record(1, "P", "G", Dictionary(), user)));
    }
    EXPECT_EQ(tree(), Texts{});
    EXPECT_EQ(readFile(directory / "victim"), "mine");
}

TEST_F(LocalConduit, WritesThroughNoLinkThatSomebodyPlanted) {
    const std::string own = directory / "own";
    fs::create_directories(own);
    std::ofstream(own + "/P") << "mine";
    fs::create_directories(at("G"));
    fs::create_directory_symlink(own, at("People"));
    fs::create_symlink(own + "/P", at("G/P"));
    fs::create_symlink(own + "/P", at("G/info"));
    fs::create_symlink(own + "/P", at("H"));
    for (const char* group : {"G", "H"}) {
        apply(CXDUpdateRecord, "P", nullptr, Dictionary{{"First", "Eve"}});
        apply(CXDCreateStructureForGroup, nullptr, group, Dictionary());
        apply(CXDAddRecordToGroup, "P", group);
        apply(CXDChangeGroupName, nullptr, group, "New");
        apply(CXDCompositeGroupChange, nullptr, group, Dictionary{{"adds", Array{"x"}}});
    }
    EXPECT_EQ(readFile(own + "/P"), "mine");
    EXPECT_EQ(std::distance(fs::directory_iterator(own), fs::directory_iterator()), 1);
    struct stat status {};
    ASSERT_EQ(::stat((own + "/P").c_str(), &status), 0);
    EXPECT_NE(status.st_mode & 0777, 0777u);
}

TEST_F(LocalConduit, AStateThatIsThereAndCannotBeReadIsNotReplaced) {
    fs::create_directories(at(""));
    fs::create_symlink("/nowhere", at("G"));
    EXPECT_TRUE(apply(CXDCompositeGroupChange, nullptr, "G", Dictionary{{"adds", Array{"x"}}}));
    EXPECT_TRUE(fs::is_symlink(at("G")));
}
