#include "server/mod_davacl/AccessLists.h"
#include "server/mod_davacl/GroupFile.h"
#include "server/mod_davacl/ListStore.h"
#include "server/mod_davacl/Needs.h"
#include "server/mod_davacl/TreePath.h"

#include "StoreTestWorld.h"
#include "foundation/Paths.h"

#include <atomic>
#include <fcntl.h>
#include <future>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <rapidcheck/gtest.h>
#include <sys/file.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

namespace rolvane::davacl {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

Principal user(const std::string& name) {
    return {Principal::Kind::user, name};
}

OwnersLists sample() {
    OwnersLists lists;
    lists.set("Contacts", {{user("walter"), true, true}, {{Principal::Kind::group, "the readers"}, true, false}});
    lists.set("", {{{Principal::Kind::authenticated, ""}, true, false}});
    return lists;
}

TEST(OwnersListsText, IsOneLineAnEntry) {
    EXPECT_EQ(sample().text(), "davacl 1\n/ r authenticated\n/Contacts rw user walter\n"
                               "/Contacts r group the%20readers\nend\n");
    EXPECT_EQ(OwnersLists().text(), "davacl 1\nend\n");
}

TEST(OwnersListsText, IsReadAsItWasWritten) {
    const auto back = OwnersLists::parse(sample().text());
    ASSERT_TRUE(back);
    EXPECT_TRUE(*back == sample());
}

TEST(OwnersListsText, CutAnywhereIsNotRead) {
    const std::string text = sample().text();
    for (size_t n = 0; n < text.size(); ++n) EXPECT_FALSE(OwnersLists::parse(text.substr(0, n))) << n;
}

TEST(OwnersListsText, OfAnyOtherFormIsNotRead) {
    for (const char* entry : {"",
                              " ",
                              "/",
                              "/ r",
                              "/ r ",
                              "/ x user a",
                              "/ wr user a",
                              "/  user a",
                              "/ r user",
                              "/ r user ",
                              "/ r user a b",
                              "Contacts r user a",
                              "/ r somebody a",
                              "/ r authenticated x",
                              "/%4 r user a",
                              "/%zz r user a",
                              "/%2f%0 r user a",
                              "/ r user %2e%2e",
                              "/ r user a%2Fb",
                              "/ r user a%0A",
                              "/ r user a\r",
                              "/a\tb r user a",
                              "davacl 1"})
        EXPECT_FALSE(OwnersLists::parse("davacl 1\n" + std::string(entry) + "\nend\n")) << "\"" << entry << "\"";
    for (const char* text :
         {"", "davacl 2\nend\n", "davacl 1\nend\nx", "davacl 1\nend\nend\n", "davacl 1\r\nend\r\n", "end\n"})
        EXPECT_FALSE(OwnersLists::parse(text)) << text;
}

RC_GTEST_PROP(OwnersListsText, AnyListsSurviveBeingWritten,
              (const std::vector<std::tuple<std::string, std::string, int>>& entries)) {
    OwnersLists lists;
    for (const auto& [tree, name, bits] : entries) {
        if (!isUsableName(name)) continue;
        AccessList list = lists.at(tree);
        addGrant(list,
                 {{bits & 4 ? Principal::Kind::group : Principal::Kind::user, name}, (bits & 1) != 0, (bits & 2) != 0});
        lists.set(tree, list);
    }
    const auto back = OwnersLists::parse(lists.text());
    RC_ASSERT(back.has_value());
    RC_ASSERT(*back == lists);
}

RC_GTEST_PROP(OwnersListsText, AnyBytesAreReadOrRefused, (const std::string& noise)) {
    (void)OwnersLists::parse(noise);
    const auto lists = OwnersLists::parse("davacl 1\n" + noise + "\nend\n");
    if (lists) RC_ASSERT(OwnersLists::parse(lists->text()) == lists);
}

TEST(OwnersListsGrant, WhatEveryPlaceOnTheWayDownGrantsTogether) {
    OwnersLists lists;
    lists.set("", {{user("a"), true, false}});
    lists.set("Contacts", {{user("a"), false, true}, {user("b"), true, false}});
    const Caller a{"a", {}}, b{"b", {}};
    EXPECT_EQ(lists.granted(a, {}), kReading);
    EXPECT_EQ(lists.granted(a, {"Contacts", "x", "y"}), kReading | kWriting);
    EXPECT_EQ(lists.granted(a, {"Contact"}), kReading);
    EXPECT_EQ(lists.granted(b, {}), 0u);
    EXPECT_EQ(lists.granted(b, {"Contacts"}), kReading);
    EXPECT_EQ(lists.granted(b, {"Contacts2"}), 0u);
    EXPECT_EQ(lists.granted(b, {"contacts"}), 0u);
}

TEST(OwnersListsGrant, GroupsByMembershipAndEverybodyWhoIsSignedIn) {
    OwnersLists lists;
    lists.set("", {{{Principal::Kind::group, "g"}, true, true}});
    EXPECT_EQ(lists.granted({"a", {"g"}}, {}), kReading | kWriting);
    EXPECT_EQ(lists.granted({"g", {}}, {}), 0u) << "a user of the group's name is not the group";
    lists.set("", {{{Principal::Kind::authenticated, ""}, true, false}});
    EXPECT_EQ(lists.granted({"anyone", {}}, {}), kReading);
    EXPECT_EQ(lists.granted({"", {}}, {}), 0u);
}

TEST(OwnersListsGrant, NothingThatIsTheOwnersAlone) {
    EXPECT_EQ((kReading | kWriting) & (kReadAcl | kWriteAcl), 0u);
}

TEST(OwnersListsTrees, GoAndMoveWithEverythingBelow) {
    OwnersLists lists;
    const AccessList one = {{user("a"), true, false}};
    for (const char* tree : {"A", "A/x", "AB", "B"}) lists.set(tree, one);
    lists.move("A", "B");
    EXPECT_THAT(lists.at("A"), IsEmpty());
    EXPECT_EQ(lists.at("B/x"), one);
    EXPECT_EQ(lists.at("AB"), one);
    EXPECT_TRUE(lists.drop("B"));
    EXPECT_FALSE(lists.drop("B"));
    EXPECT_FALSE(lists.has("B"));
    EXPECT_TRUE(lists.drop("")) << "the whole of the owner's";
    EXPECT_TRUE(lists.empty());
}

TEST(AccessList, JoinsWhatOnePrincipalIsGranted) {
    AccessList list;
    addGrant(list, {user("a"), true, false});
    addGrant(list, {user("b"), false, false});
    addGrant(list, {user("a"), false, true});
    EXPECT_EQ(list, (AccessList{{user("a"), true, true}}));
}

TEST(TreePath, TakesTheFirstSegmentBelowTheBaseForTheOwner) {
    EXPECT_FALSE(TreePath::of("/dav", "/davx/alice"));
    EXPECT_FALSE(TreePath::of("/dav", "/other"));
    EXPECT_FALSE(TreePath::of("/dav", "/"));
    EXPECT_TRUE(TreePath::of("/dav", "/dav")->isBase());
    EXPECT_TRUE(TreePath::of("/dav", "/dav//")->isBase());
    const auto path = TreePath::of("/dav", "/dav//alice/Contacts//x/");
    EXPECT_EQ(path->owner, "alice");
    EXPECT_THAT(path->below, ElementsAre("Contacts", "x"));
    EXPECT_EQ(path->levels(), 3u);
    EXPECT_EQ(path->tree(1), "Contacts");
    EXPECT_EQ(path->parent().tree(), "Contacts");
    EXPECT_TRUE(path->parent().parent().parent().isBase());
    EXPECT_TRUE(path->isWithin(path->parent()));
    EXPECT_FALSE(path->parent().isWithin(*path));
}

TEST(TreePath, KnowsTheNamesThatHttpdKeepsForItself) {
    for (const char* path : {"/dav/a/.htaccess", "/dav/a/.HtPasswd/x", "/dav/.DAV", "/dav/a/b/.dav/c"})
        EXPECT_TRUE(TreePath::of("/dav", path)->isReserved()) << path;
    for (const char* path : {"/dav/a/htaccess", "/dav/a/.davx", "/dav/a/x.DAV", "/dav"})
        EXPECT_FALSE(TreePath::of("/dav", path)->isReserved()) << path;
}

TEST(Needs, AreThoseOfTheMethodAndWhatStandsThere) {
    using Many = std::vector<Need>;
    EXPECT_EQ(needsOf("PUT", Standing::file), (Many{{kWriteContent, false}}));
    EXPECT_EQ(needsOf("PUT", Standing::nothing), (Many{{kBind, true}}));
    EXPECT_EQ(needsOf("DELETE", Standing::collection), (Many{{kUnbind, true}}));
    EXPECT_EQ(needsOf("MOVE", Standing::file), (Many{{kRead, false}, {kUnbind, true}}));
    EXPECT_EQ(needsOfDestination("COPY", Standing::collection), (Many{{kUnbind, true}, {kBind, true}}));
    EXPECT_EQ(needsOfDestination("COPY", Standing::nothing), (Many{{kBind, true}}));
    EXPECT_EQ(needsOf("ACL", Standing::collection), (Many{{kWriteAcl, false}}));
    EXPECT_EQ(needsOf("NEVERHEARDOF", Standing::file).size(), 8u);
    EXPECT_EQ(needsOf("get", Standing::file).size(), 8u) << "methods are taken to the letter";
}

TEST(GroupFile, IsReadAsHttpdReadsIt) {
    const std::string text =
        "# a comment: x\n\nreaders: greta  rita\r\nothers:rita\nreaders: sam\nno colon\n: nobody\nempty:\n";
    EXPECT_THAT(groupsOf("rita", text), ElementsAre("others", "readers"));
    EXPECT_THAT(groupsOf("sam", text), ElementsAre("readers"));
    EXPECT_THAT(groupsOf("gret", text), IsEmpty());
    EXPECT_THAT(usersIn("readers", text), ElementsAre("greta", "rita", "sam"));
    EXPECT_THAT(groupsIn(text), ElementsAre("empty", "others", "readers"));
    EXPECT_THAT(groupsOf("x", "# a comment: x"), IsEmpty());
}

TEST(Privileges, ThatAListCanGrantAreReadingAndWriting) {
    EXPECT_EQ(useOf("read"), PrivilegeUse::concrete);
    EXPECT_EQ(useOf("write"), PrivilegeUse::concrete);
    for (const char* name : {"all", "bind", "unbind", "write-acl", "read-acl", "write-content"})
        EXPECT_EQ(useOf(name), PrivilegeUse::abstract) << name;
    EXPECT_EQ(useOf("fly"), PrivilegeUse::unknown);
    EXPECT_EQ(privilegeElements(0), "");
}

// -- on disk

TEST(ListStore, KeepsTheListsOfEachOwnerInAFileOfTheirOwn) {
    const StoreDirectory directory;
    const ListStore store(directory.path());
    EXPECT_TRUE(store.read("alice")->empty());
    ASSERT_TRUE(store.write("alice", sample()));
    EXPECT_TRUE(*store.read("alice") == sample());
    EXPECT_TRUE(store.read("bob")->empty());
    struct stat info {};
    ASSERT_EQ(stat(store.pathFor("alice").c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 0777, 0600u);
    ASSERT_TRUE(store.write("alice", OwnersLists()));
    EXPECT_NE(access(store.pathFor("alice").c_str(), F_OK), 0);
    EXPECT_TRUE(std::filesystem::is_empty(directory.path())) << "nothing half written is left";
}

TEST(ListStore, TurnsAnyOwnerIntoAFileNameInItsDirectory) {
    const ListStore store("/d");
    EXPECT_EQ(store.pathFor("alice@example.org"), "/d/alice@example.org.acl");
    EXPECT_EQ(store.pathFor(".."), "/d/%2E..acl");
    EXPECT_EQ(store.pathFor("../x"), "/d/%2E.%2Fx.acl");
    EXPECT_EQ(store.pathFor("a\n/b"), "/d/a%0A%2Fb.acl");
}

TEST(ListStore, TellsDamageFromAbsence) {
    const StoreDirectory directory;
    const ListStore store(directory.path());
    writeFileDurably(store.pathFor("alice"), "davacl 1\n/ r user bob\n");
    EXPECT_FALSE(store.read("alice"));
    std::filesystem::create_symlink(store.pathFor("alice"), store.pathFor("bob"));
    EXPECT_FALSE(store.read("bob")) << "a link is not followed";
    EXPECT_FALSE(ListStore(directory.path("missing")).write("alice", sample()));
}

TEST(ListStore, AProcessThatIsKilledWhileWritingLeavesOneVersionOrTheOther) {
    const StoreDirectory directory;
    const ListStore store(directory.path());
    OwnersLists other = sample();
    other.set("Contacts", {{user("z"), true, false}});
    ASSERT_TRUE(store.write("alice", sample()));
    for (int round = 0; round < 20; ++round) {
        const pid_t child = fork();
        if (child == 0)
            for (;;)
                if (!store.write("alice", other) || !store.write("alice", sample())) _exit(1);
        usleep(static_cast<useconds_t>(200 +
                                       137 * round)); // somewhere in the middle of a write, a different place each time
        kill(child, SIGKILL);
        waitpid(child, nullptr, 0);
        const auto found = store.read("alice");
        ASSERT_TRUE(found) << round;
        EXPECT_TRUE(*found == sample() || *found == other);
    }
}

TEST(ListStore, WhoComesWhileTheOwnerWaitsStandsBehindTheOwner) {
    const StoreDirectory directory;
    const ListStore store(directory.path());
    auto writing = store.guard("alice", ListStore::Hold::shared);
    std::atomic<int> place = 0;
    auto owner = std::async(std::launch::async, [&] {
        const auto held = store.guard("alice", ListStore::Hold::exclusive);
        return held ? ++place : 0;
    });
    const int gate = open(store.pathFor("alice", ".gate").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    while (flock(gate, LOCK_EX | LOCK_NB) == 0) flock(gate, LOCK_UN); // until the owner stands there
    close(gate);
    auto next = std::async(std::launch::async, [&] {
        const auto held = store.guard("alice", ListStore::Hold::shared);
        return held ? ++place : 0;
    });
    EXPECT_EQ(next.wait_for(std::chrono::milliseconds(100)), std::future_status::timeout);
    writing = ListStore::Guard();
    EXPECT_EQ(owner.get(), 1);
    EXPECT_EQ(next.get(), 2);
}

TEST(ListStore, AnExclusiveGuardWaitsForTheSharedOnes) {
    const StoreDirectory directory;
    const ListStore store(directory.path());
    auto first = store.guard("alice", ListStore::Hold::shared);
    auto second = store.guard("alice", ListStore::Hold::shared);
    ASSERT_TRUE(first && second);
    EXPECT_TRUE(store.guard("bob", ListStore::Hold::exclusive)) << "another owner's";
    std::atomic<bool> released = false, afterwards = false;
    std::thread waiting([&] {
        const auto exclusive = store.guard("alice", ListStore::Hold::exclusive);
        afterwards = released.load();
    });
    first = ListStore::Guard();
    released = true;
    second = ListStore::Guard();
    waiting.join();
    EXPECT_TRUE(afterwards);
}

} // namespace
} // namespace rolvane::davacl
