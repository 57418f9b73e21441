#include "AccessWorld.h"
#include "foundation/Paths.h"
#include "server/mod_davacl/AccessLists.h"
#include "server/mod_davacl/Privileges.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <rapidcheck/gtest.h>

namespace rolvane {
namespace {

using davacl::AccessList;
using davacl::Caller;
using davacl::Grant;
using davacl::OwnersLists;
using davacl::Principal;
using Kind = Principal::Kind;

std::string denial(const std::string& principal, const std::string& privileges) {
    std::string text = AccessWorld::ace(principal, privileges);
    text.replace(text.find("<D:grant>"), 9, "<D:deny>");
    return text.replace(text.find("</D:grant>"), 10, "</D:deny>");
}

// -- the lists as values

TEST(Denials, OfAGrantAndADenialTheFirstCounts) {
    const Grant grant{{Kind::user, "rita"}, true, true}, denial{{Kind::authenticated, ""}, false, true, true};
    OwnersLists lists;
    lists.set("", {grant, denial});
    EXPECT_EQ(lists.granted({"rita", {}}, {}), davacl::kReading | davacl::kWriting);
    lists.set("", {denial, grant});
    EXPECT_EQ(lists.granted({"rita", {}}, {}), davacl::kReading);
}

TEST(Denials, TheNearerListCounts) {
    OwnersLists lists;
    lists.set("", {{{Kind::user, "rita"}, true, true}});
    lists.set("Private", {{{Kind::all, ""}, true, true, true}});
    lists.set("Private/for rita", {{{Kind::user, "rita"}, true, false}});
    const Caller rita{"rita", {}};
    EXPECT_EQ(lists.granted(rita, {}), davacl::kReading | davacl::kWriting);
    EXPECT_EQ(lists.granted(rita, {"Private"}), 0u);
    EXPECT_EQ(lists.granted(rita, {"Private", "for rita"}), davacl::kReading);
}

TEST(Denials, ForAGroupWhoseMembersAreUnknownConcernEverybody) {
    OwnersLists lists;
    lists.set("", {{{Kind::group, "away"}, true, true, true}, {{Kind::user, "rita"}, true, false}});
    EXPECT_EQ(lists.granted({"rita", {}}, {}), davacl::kReading);
    EXPECT_EQ(lists.granted({"rita", {}, false}, {}), 0u);
}

TEST(Denials, ForWhoeverIsNotSignedInConcernNobodyWhoHasAName) {
    OwnersLists lists;
    lists.set("", {{{Kind::unauthenticated, ""}, true, true, true}, {{Kind::all, ""}, true, false}});
    EXPECT_EQ(lists.granted({"rita", {}}, {}), davacl::kReading);
    EXPECT_EQ(lists.granted({"", {}}, {}), 0u);
}

// The rule itself, entry by entry for one privilege (RFC 3744 section 6).
bool mayByTheRule(const OwnersLists& lists, const std::vector<std::string>& way, const Caller& who, bool write) {
    for (size_t level = way.size() + 1; level-- > 0;) {
        std::string tree;
        for (size_t i = 0; i < level; ++i) tree += (i ? "/" : "") + way[i];
        for (const Grant& entry : lists.at(tree)) {
            const bool his = entry.principal.kind == Kind::authenticated || entry.principal.kind == Kind::all ||
                             (entry.principal.kind == Kind::user && entry.principal.name == who.name) ||
                             (entry.principal.kind == Kind::group && who.groups.contains(entry.principal.name));
            if (his && (write ? entry.write : entry.read)) return !entry.denies;
        }
    }
    return false;
}

RC_GTEST_PROP(Denials, JoinedWrittenAndReadTheListsSayTheSameAsTheirEntriesOneByOne, ()) {
    OwnersLists asNamed, joined;
    const std::vector<std::vector<std::string>> places = {{}, {"a"}, {"a", "b"}};
    for (const std::string tree : {"", "a", "a/b"}) {
        AccessList all, list;
        const int count = *rc::gen::inRange(0, 7);
        for (int i = 0; i < count; ++i) {
            const int bits = *rc::gen::inRange(1, 4);
            const auto kind = *rc::gen::element(Kind::user, Kind::group, Kind::authenticated, Kind::unauthenticated);
            const bool named = kind == Kind::user || kind == Kind::group;
            const Grant entry{{kind, named ? *rc::gen::element<std::string>("x", "y") : std::string()},
                              (bits & 1) != 0,
                              (bits & 2) != 0,
                              *rc::gen::arbitrary<bool>()};
            all.push_back(entry);
            addGrant(list, entry);
        }
        asNamed.set(tree, all);
        joined.set(tree, list);
    }
    const auto back = OwnersLists::parse(joined.text());
    RC_ASSERT(back == joined);
    RC_ASSERT(OwnersLists::parse(asNamed.text()) == joined); // reading joins what setting joins
    for (const Caller& who : {Caller{"x", {}}, Caller{"x", {"y"}}, Caller{"z", {"x", "y"}}, Caller{"y", {"x"}}})
        for (const auto& way : places) {
            const unsigned granted = joined.granted(who, way);
            RC_ASSERT(((granted & davacl::kRead) != 0) == mayByTheRule(asNamed, way, who, false));
            RC_ASSERT(((granted & davacl::kBind) != 0) == mayByTheRule(asNamed, way, who, true));
        }
}

// -- the same with httpd

class DenialsOnStore : public testing::Test {
protected:
    static void SetUpTestSuite() { world = std::make_unique<AccessWorld>(); }
    static void TearDownTestSuite() { world.reset(); }
    void SetUp() override { world->reset(); }

    int set(const std::string& aces, const std::string& path = "/dav/alice/Contacts/") {
        return world->status("alice", "ACL", path, {}, AccessWorld::acl(aces));
    }
    int read(const std::string& user) { return world->status(user, "GET", "/dav/alice/Contacts/dateFile"); }
    static std::unique_ptr<AccessWorld> world;
};
std::unique_ptr<AccessWorld> DenialsOnStore::world;

TEST_F(DenialsOnStore, AreKeptInOrderAndReadBackAsTheyWereSet) {
    const std::string list = AccessWorld::ace(AccessWorld::user("rita"), "read") +
                             denial(AccessWorld::group("others"), "read write") +
                             AccessWorld::ace("<D:authenticated/>", "read") + denial("<D:unauthenticated/>", "read") +
                             denial("<D:all/>", "read write");
    ASSERT_EQ(set(list), 200);
    std::string shown = world
                            ->ask("alice", "PROPFIND", "/dav/alice/Contacts/", {{"Depth", "0"}},
                                  AccessWorld::propfind("acl acl-restrictions"))
                            .body;
    std::erase(shown, '\n');
    EXPECT_THAT(shown, testing::HasSubstr(list));
    EXPECT_THAT(shown, testing::HasSubstr("<D:acl-restrictions><D:no-invert/></D:acl-restrictions>"));
    const size_t from = shown.find("<D:acl>") + 7;
    ASSERT_EQ(set(shown.substr(from, shown.find("</D:acl>") - from)), 200);
    EXPECT_EQ(read("rita"), 200);
    EXPECT_EQ(read("greta"), 200);
    EXPECT_EQ(read("sam"), 403) << "denied to the group others, before everybody may read";
    EXPECT_EQ(read("alice"), 200);
}

TEST_F(DenialsOnStore, TakeFromAPlaceWhatAPlaceAboveGrants) {
    ASSERT_EQ(set(AccessWorld::ace("<D:all/>", "read"), "/dav/alice/"), 200);
    EXPECT_EQ(read("sam"), 200);
    ASSERT_EQ(set(denial(AccessWorld::user("sam"), "read")), 200);
    EXPECT_EQ(read("sam"), 403);
    EXPECT_EQ(read("rita"), 200);
    EXPECT_EQ(world->status("sam", "GET", "/dav/alice/own"), 200);
    const std::string listing =
        world->ask("sam", "PROPFIND", "/dav/alice/", {{"Depth", "1"}}, AccessWorld::propfind("resourcetype")).body;
    EXPECT_THAT(listing, testing::Not(testing::HasSubstr("Contacts")));
}

TEST_F(DenialsOnStore, TakeTheLocksOfWhomTheyConcern) {
    ASSERT_EQ(world->status("walter", "LOCK", "/dav/alice/Contacts/dateFile", {}, AccessWorld::kLock), 200);
    ASSERT_EQ(set(denial("<D:authenticated/>", "write") + AccessWorld::ace(AccessWorld::user("walter"), "read write")),
              200);
    EXPECT_EQ(world->status("alice", "PUT", "/dav/alice/Contacts/dateFile", {}, "x"), 204);
}

TEST_F(DenialsOnStore, HoldForACopyOfAllThatIsAroundThem) {
    ASSERT_EQ(set(AccessWorld::ace("<D:all/>", "read"), "/dav/alice/"), 200);
    ASSERT_EQ(set(denial(AccessWorld::user("sam"), "read")), 200);
    for (const auto& depth :
         std::vector<std::vector<std::pair<std::string, std::string>>>{{}, {{"Depth", "infinity"}}}) {
        auto headers = depth;
        headers.emplace_back("Destination", "/dav/sam/loot");
        const RawAnswer answer = world->ask("sam", "COPY", "/dav/alice/", headers);
        EXPECT_EQ(answer.status, 403);
        EXPECT_EQ(answer.precondition(), "need-privileges");
        EXPECT_THAT(answer.body, testing::Not(testing::HasSubstr("Contacts"))) << "no listing shows its name either";
    }
    EXPECT_FALSE(std::filesystem::exists(world->store.userDirectory("sam") + "/loot"));
    EXPECT_EQ(world->status("sam", "COPY", "/dav/alice/", {{"Destination", "/dav/sam/loot"}, {"Depth", "0"}}), 201);
    EXPECT_TRUE(std::filesystem::is_empty(world->store.userDirectory("sam") + "/loot"));
    EXPECT_EQ(world->status("rita", "COPY", "/dav/alice/", {{"Destination", "/dav/rita/copy"}}), 201);
    EXPECT_EQ(world->status("alice", "COPY", "/dav/alice/Contacts/", {{"Destination", "/dav/alice/again"}}), 201);
}

TEST_F(DenialsOnStore, HoldForALockOnAllThatIsAroundThem) {
    ASSERT_EQ(set(AccessWorld::ace(AccessWorld::user("walter"), "read write"), "/dav/alice/"), 200);
    ASSERT_EQ(
        set(denial(AccessWorld::user("walter"), "write") + AccessWorld::ace(AccessWorld::user("rita"), "read write")),
        200);
    ASSERT_EQ(world->status("walter", "PUT", "/dav/alice/Contacts/dateFile", {}, "x"), 403);
    EXPECT_EQ(world->status("walter", "LOCK", "/dav/alice/", {}, AccessWorld::kLock), 403);
    EXPECT_EQ(world->status("walter", "LOCK", "/dav/alice/", {{"Depth", "infinity"}}, AccessWorld::kLock), 403);
    EXPECT_EQ(world->status("rita", "PUT", "/dav/alice/Contacts/dateFile", {}, "why"), 204);
    EXPECT_EQ(world->status("walter", "LOCK", "/dav/alice/", {{"Depth", "0"}}, AccessWorld::kLock), 200);
    EXPECT_EQ(world->status("rita", "PUT", "/dav/alice/Contacts/dateFile", {}, "why"), 204);
    EXPECT_EQ(world->status("walter", "LOCK", "/dav/alice/own", {}, AccessWorld::kLock), 200);
}

TEST_F(DenialsOnStore, ForAGroupHoldWhileTheGroupFileIsMissing) {
    const std::string groups = world->store.stateDirectory() + "/conf/groups";
    ASSERT_EQ(set(denial(AccessWorld::group("others"), "read") + AccessWorld::ace("<D:authenticated/>", "read")), 200);
    EXPECT_EQ(read("rita"), 200);
    EXPECT_EQ(read("sam"), 403);
    const std::string before = readFile(groups);
    std::filesystem::remove(groups);
    EXPECT_EQ(read("sam"), 403);
    EXPECT_EQ(read("alice"), 200);
    writeFileDurably(groups, before, 0644);
    EXPECT_EQ(read("rita"), 200);
}

} // namespace
} // namespace rolvane
