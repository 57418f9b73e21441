#include "AclStore.h"
#include "StoreWorld.h"
#include "store/dav/CXACE.h"
#include "store/dav/CXDAVQuery.h"
#include "support/CapturingLog.h"

#include <gtest/gtest.h>
#include <rapidcheck.h>

namespace rolvane {
namespace {

using namespace test;
using Names = std::vector<std::string>;

CXDAVNode parsed(const std::string& inner) {
    const auto root = parseDAVTree("<?xml version=\"1.0\"?>" + inner);
    return root ? root->childAtIndex(0).childAtIndex(0) : CXDAVNode::text("not well formed");
}
std::optional<CXACE> aceOf(const std::string& inner) {
    return CXACE::initWithACENode(parsed("<D:ace xmlns:D=\"DAV:\">" + inner + "</D:ace>"));
}
std::optional<CXACE> rightsOf(const std::string& privileges) {
    return CXACE::initWithCurrentUserPrivNode(
        parsed("<D:current-user-privilege-set xmlns:D=\"DAV:\">" + privileges + "</D:current-user-privilege-set>"));
}
std::string privilege(const std::string& name) {
    return "<D:privilege><D:" + name + "/></D:privilege>";
}

// -- trees

TEST(AnswerTree, StandsBelowTwoNodesWithoutAName) {
    const auto root = parseDAVTree("<?xml version=\"1.0\"?>\n<D:multistatus xmlns:D=\"DAV:\">\n  <D:response/>\n"
                                   "</D:multistatus>\n");
    ASSERT_TRUE(root);
    ASSERT_EQ(root->childCount(), 1u);
    ASSERT_EQ(root->childAtIndex(0).childCount(), 1u);
    const auto found = root->childAtIndex(0).childNodesMatchingString("multistatus");
    ASSERT_EQ(found.size(), 1u);
    EXPECT_EQ(found[0]->childCount(), 1u) << "white space between elements is no node";
    EXPECT_TRUE(davResponses(*root));
}

TEST(AnswerTree, TellsNamespacesApartWhateverThePrefixes) {
    const CXDAVNode node = parsed("<a xmlns=\"DAV:\"><x:a xmlns:x=\"urn:x\"/><b xmlns=\"\"/>text &amp; more</a>");
    EXPECT_EQ(node.string(), "a");
    ASSERT_EQ(node.childCount(), 3u);
    EXPECT_EQ(node.childAtIndex(0).string(), "{urn:x}a");
    EXPECT_EQ(node.childAtIndex(1).string(), "{}b");
    EXPECT_EQ(node.childAtIndex(2).string(), "text & more");
    EXPECT_TRUE(node.childAtIndex(2).isText());
    EXPECT_EQ(node.childNodesMatchingString("text & more").size(), 0u) << "a text is no element";
}

TEST(AnswerTree, IsNothingWhenTheTextIsNotWholeOrPassesALimit) {
    const std::string whole = "<?xml version=\"1.0\"?><D:a xmlns:D=\"DAV:\"><D:b>t</D:b></D:a>";
    ASSERT_TRUE(parseDAVTree(whole));
    for (size_t n = 0; n < whole.size(); ++n) EXPECT_FALSE(parseDAVTree(whole.substr(0, n))) << n;
    EXPECT_FALSE(parseDAVTree(whole + "<again/>"));
    EXPECT_FALSE(parseDAVTree("<!DOCTYPE a [<!ENTITY e \"v\">]><a>&e;</a>"));
    EXPECT_FALSE(parseDAVTree("<a><b><c/></b></a>", {2, 100}));
    EXPECT_FALSE(parseDAVTree("<a><b/><b/><b/><b/></a>", {32, 4}));
}

TEST(AnswerTree, WrittenAsTextReadsBackAsTheSameTree) {
    const std::string hard =
        "<D:ace xmlns:D=\"DAV:\"><x:p xmlns:x='urn:a&amp;\"b'>1 &lt; 2 &amp; \"q\"</x:p><n xmlns=\"\"/>"
        "</D:ace>";
    const CXDAVNode node = parsed(hard);
    EXPECT_EQ(parsed(node.xml()).xml(), node.xml());
    EXPECT_EQ(parsed(node.xml()).childAtIndex(0).string(), "{urn:a&\"b}p");
    EXPECT_EQ(parsed(node.xml()).childAtIndex(0).content(), "1 < 2 & \"q\"");
    EXPECT_EQ(parsed(node.xml()).childAtIndex(1).string(), "{}n");
}

TEST(AnswerTree, EscapesAnyTextSoThatItReadsBack) {
    EXPECT_TRUE(rc::check([] {
        const auto text = *rc::gen::container<std::string>(rc::gen::inRange<char>(0x20, 0x7f));
        const CXDAVNode node = parsed("<a>" + CXDAVNode::escaped("x" + text + "x") + "</a>");
        RC_ASSERT(node.content() == "x" + text + "x");
    }));
}

// -- entries

TEST(AccessEntry, OfTheCurrentUserIsNothingWithoutAPrivilege) {
    EXPECT_FALSE(rightsOf(""));
    EXPECT_FALSE(rightsOf("<D:privilege/>"));
    EXPECT_FALSE(
        CXACE::initWithCurrentUserPrivNode(parsed("<D:other xmlns:D=\"DAV:\">" + privilege("write") + "</D:other>")));
    EXPECT_FALSE(CXACE::initWithCurrentUserPrivNode(parsed(
        "<current-user-privilege-set xmlns=\"urn:x\"><privilege><write/></privilege></current-user-privilege-set>")))
        << "another namespace's element of that name";
}

TEST(AccessEntry, MayWriteWithWriteOrAllOrAllPartsOfWrite) {
    EXPECT_FALSE(rightsOf(privilege("read"))->canWrite());
    EXPECT_TRUE(rightsOf(privilege("read") + privilege("write"))->canWrite());
    EXPECT_TRUE(rightsOf(privilege("all"))->canWrite());
    EXPECT_TRUE(rightsOf(privilege("all"))->canRead());
    const std::string parts = privilege("bind") + privilege("unbind") + privilege("write-content");
    EXPECT_FALSE(rightsOf(parts)->canWrite());
    EXPECT_TRUE(rightsOf(parts + privilege("write-properties"))->canWrite());
    EXPECT_FALSE(rightsOf("<D:privilege><x:write xmlns:x=\"urn:x\"/></D:privilege>")->canWrite());
}

TEST(AccessEntry, KnowsItsPrincipalAndWhatItIs) {
    const auto grant = aceOf("<D:principal><D:href> /principals/b%20b </D:href></D:principal><D:grant>" +
                             privilege("read") + "</D:grant>");
    ASSERT_TRUE(grant);
    EXPECT_EQ(grant->href(), "/principals/b%20b");
    EXPECT_TRUE(grant->isGrant() && grant->canRead() && grant->isPlain());
    EXPECT_FALSE(grant->canWrite() || grant->isProtected() || grant->isInherited() || grant->isInverted());

    const auto other =
        aceOf("<D:invert><D:principal><D:all/></D:principal></D:invert><D:deny>" + privilege("write-acl") +
              "</D:deny><D:protected/><D:inherited><D:href>/</D:href></D:inherited>");
    ASSERT_TRUE(other);
    EXPECT_EQ(other->principal(), CXACE::Principal::all);
    EXPECT_TRUE(other->isInverted() && other->isProtected() && other->isInherited());
    EXPECT_FALSE(other->isGrant() || other->isPlain());
}

TEST(AccessEntry, ThatIsNotUnderstoodIsNone) {
    const std::string who = "<D:principal><D:all/></D:principal>",
                      grant = "<D:grant>" + privilege("read") + "</D:grant>";
    ASSERT_TRUE(aceOf(who + grant));
    EXPECT_FALSE(aceOf(who));
    EXPECT_FALSE(aceOf(grant));
    EXPECT_FALSE(aceOf(who + grant + "<D:deny/>"));
    EXPECT_FALSE(aceOf("<D:principal/>" + grant));
    EXPECT_FALSE(aceOf("<D:principal><D:all/><D:self/></D:principal>" + grant));
    EXPECT_FALSE(aceOf("<D:principal><x:new xmlns:x=\"urn:x\"/></D:principal>" + grant));
}

// -- the query

TEST(Query, AsksUnboundedFirstAndAboutTheResourceItselfWhereThatIsRefused) {
    AclStore store;
    Names depths;
    store.instead = [&](const HttpRequest& r) -> std::optional<HttpResponse> {
        if (r.method != "PROPFIND") return std::nullopt;
        for (const auto& [name, value] : r.headers)
            if (name == "Depth") depths.push_back(value);
        if (depths.back() == "infinity") return answerOf(403);
        return AclStore::multistatus(AclStore::response("/dav/alice/Contacts", ""));
    };
    CXDAVQuery query(*store.manager, store.base);
    query.setBody("<the body/>");
    query.setUserAgent("Someone/1");
    EXPECT_TRUE(query.execute());
    EXPECT_TRUE(query.succeeded());
    EXPECT_EQ(depths, (Names{"infinity", "0"}));
    EXPECT_EQ(store.wire->exchanges().back().header("User-Agent"), "Someone/1");
    EXPECT_EQ(store.bodies.front(), "<the body/>");
}

TEST(Query, IsAskedOnceWhenTheServerServesTheDepth) {
    AclStore store;
    store.instead = [](const HttpRequest&) {
        return std::optional(AclStore::multistatus(AclStore::response("/dav/alice/Contacts", "")));
    };
    EXPECT_TRUE(CXDAVQuery(*store.manager, store.base).execute());
    EXPECT_EQ(store.wire->methods(), "PROPFIND");
}

TEST(Query, FailsOnceForAnythingElseThanTheDepth) {
    for (const int status : {200, 301, 401, 404, 500}) {
        AclStore store;
        store.instead = [=](const HttpRequest& r) -> std::optional<HttpResponse> {
            return r.method == "OPTIONS" ? std::nullopt : std::optional(answerOf(status));
        };
        CXDAVQuery query(*store.manager, store.base);
        EXPECT_FALSE(query.execute()) << status;
        EXPECT_FALSE(query.succeeded());
        EXPECT_EQ(query.status(), status == 200 ? 0 : status)
            << "a success of that kind is nobody's who knows the question";
        EXPECT_EQ(store.wire->count("PROPFIND"), 1u) << status;
    }
}

TEST(Query, DoesNotSucceedWithAnAnswerThatIsCutOff) {
    const std::string whole = AclStore::multistatus(AclStore::response("/dav/alice/Contacts", "")).body;
    for (size_t n = 0; n + 1 < whole.size(); n += 3) {
        AclStore store;
        store.instead = [&](const HttpRequest&) { return std::optional(answerOf(207, {}, whole.substr(0, n))); };
        CXDAVQuery query(*store.manager, store.base);
        EXPECT_FALSE(query.execute()) << n;
        EXPECT_FALSE(query.succeeded());
    }
}

TEST(Query, OfAnotherTypeOrOutsideTheStoreIsNotSent) {
    AclStore store;
    CXDAVQuery other(*store.manager, store.base);
    other.setQueryType(1);
    EXPECT_FALSE(other.execute());
    EXPECT_FALSE(CXDAVQuery(*store.manager, Url("https://elsewhere.example.org/alice/Contacts")).execute());
    EXPECT_EQ(store.wire->methods(), "");
}

// -- reading lists

class StoreLists : public testing::Test {
protected:
    // "r ...; w ..." of the client, or "unreadable"
    std::string read() {
        Names readers{"kept"}, writers{"kept"};
        if (!store.manager->ACLsAtURL(store.base.withScheme("https"), readers, writers))
            return readers == Names{"kept"} && writers == Names{"kept"} ? "unreadable" : "touched";
        std::string out = "r";
        for (const auto& name : readers) out += " " + name;
        out += "; w";
        for (const auto& name : writers) out += " " + name;
        return out;
    }
    bool set(const Names& readers, const Names& writers) {
        return store.manager->setACLsWithReadPrincipals(readers, writers, store.base);
    }
    AclStore store;
    CapturingLog log;
};

TEST_F(StoreLists, AreReadersAndWritersInTheListsOrder) {
    store.entries = {AclStore::ace("/principals/carl", {"read", "write"}), AclStore::ace("/principals/bob", {"read"}),
                     AclStore::ace("/principals/bob", {"read"}), AclStore::ace("/principals/dora", {"all"})};
    EXPECT_EQ(read(), "r carl bob dora; w carl dora");
}

TEST_F(StoreLists, LeaveOutTheOwnerAndWhatIsNoPlainGrantToOnePrincipal) {
    store.entries = {AclStore::ace("/principals/alice", {"all"}),
                     AclStore::ace("/principals/bob", {"read"}, "<D:inherited><D:href>/dav</D:href></D:inherited>"),
                     AclStore::ace("/principals/carl", {"read-acl"}),
                     "<D:ace><D:principal><D:authenticated/></D:principal><D:grant>" + privilege("read") +
                         "</D:grant></D:ace>",
                     "<D:ace><D:principal><D:href>/principals/bob</D:href></D:principal><D:deny>" + privilege("read") +
                         "</D:deny></D:ace>",
                     AclStore::ace("https://evil.example.org/principals/eve", {"write"}),
                     AclStore::ace("/principals/a%2Fb", {"write"}),
                     AclStore::ace("/", {"write"})};
    EXPECT_EQ(read(), "r; w");
}

TEST_F(StoreLists, DecodeNamesAndResolveWholeUrls) {
    store.entries = {AclStore::ace("/principals/b%C3%B6b%20%26co", {"read"}),
                     AclStore::ace("https://dav.example.org/principals/carl/", {"read"})};
    EXPECT_EQ(read(), "r b\u00f6b &co carl; w");
}

TEST_F(StoreLists, AreUnreadableWhenTheAnswerIsNotWholeOrNotShown) {
    const auto answers = [this](std::optional<HttpResponse> answer) {
        store.instead = [=](const HttpRequest& r) { return r.method == "PROPFIND" ? answer : std::nullopt; };
        return read();
    };
    const std::string shown = "<D:acl>" + AclStore::ace("/principals/bob", {"read"}) + "</D:acl>";
    EXPECT_EQ(answers(AclStore::multistatus(AclStore::response("/dav/alice/Contacts", shown))), "r bob; w");
    EXPECT_EQ(answers(AclStore::multistatus(AclStore::response("/x", shown, "404 Not Found"))), "unreadable");
    EXPECT_EQ(answers(AclStore::multistatus(AclStore::response("/x", "<D:acl/>", "403 Forbidden"))), "unreadable");
    EXPECT_EQ(answers(AclStore::multistatus("")), "unreadable");
    EXPECT_EQ(answers(AclStore::multistatus(AclStore::response("/x", shown) + AclStore::response("/y", shown))),
              "unreadable");
    EXPECT_EQ(answers(AclStore::multistatus(AclStore::response("/x", "<D:acl><D:ace/></D:acl>"))), "unreadable")
        << "an entry that is not understood";
    for (const int status : {200, 401, 403, 404, 500}) EXPECT_EQ(answers(answerOf(status)), "unreadable");
    std::string cut = AclStore::multistatus(AclStore::response("/x", shown)).body;
    for (size_t n = 0; n + 1 < cut.size(); n += 7)
        EXPECT_EQ(answers(answerOf(207, {}, cut.substr(0, n))), "unreadable");
}

TEST_F(StoreLists, GoOverTLSWhenTheNameSaysSo) {
    read();
    for (const auto& e : store.wire->exchanges()) EXPECT_EQ(e.path.rfind("/dav/alice/Contacts", 0), 0u);
    EXPECT_EQ(store.wire->methods(), "OPTIONS PROPFIND");
}

// -- setting lists

TEST_F(StoreLists, ThatAreSetAreThereAfterwards) {
    EXPECT_TRUE(set({"bob", "carl"}, {"carl"}));
    EXPECT_EQ(store.lists(), "r bob carl; w carl");
    EXPECT_TRUE(set({"carl"}, {}));
    EXPECT_EQ(store.lists(), "r carl; w");
    EXPECT_TRUE(set({}, {}));
    EXPECT_EQ(store.lists(), "r; w");
}

TEST_F(StoreLists, AWriterThatIsNoReaderIsGrantedWritingOnly) {
    EXPECT_TRUE(set({}, {"bob"}));
    EXPECT_EQ(store.lists(), "r; w bob");
}

TEST_F(StoreLists, TheOwnerAndTheOwnersMarkNeedNoEntry) {
    EXPECT_TRUE(set({"<self>", "alice", "bob"}, {"<self>", "alice"}));
    EXPECT_EQ(store.lists(), "r bob; w");
    EXPECT_EQ(store.entries.size(), 1u);
}

TEST_F(StoreLists, EntriesOfOthersKindsStayAsTheyAre) {
    const Names foreign = {
        AclStore::ace("/principals/alice", {"all"}), AclStore::ace("/principals/admin", {"read-acl", "write-acl"}),
        "<D:ace><D:principal><D:href>/principals/staff</D:href></D:principal><D:deny>" + privilege("write") +
            "</D:deny></D:ace>",
        "<D:ace><D:principal><D:authenticated/></D:principal><D:grant>" + privilege("read") + "</D:grant></D:ace>",
        "<D:ace><D:principal><D:property><x:team xmlns:x=\"urn:a&amp;b\"/></D:property></D:principal><D:grant>" +
            privilege("read") + "</D:grant></D:ace>"};
    store.entries = foreign;
    store.entries.push_back(AclStore::ace("/principals/bob", {"read"}));
    EXPECT_TRUE(set({"carl"}, {}));
    ASSERT_EQ(store.entries.size(), foreign.size() + 1);
    for (size_t i = 0; i < foreign.size(); ++i) {
        const std::string before = parsed("<w xmlns:D=\"DAV:\">" + foreign[i] + "</w>").childAtIndex(0).xml();
        EXPECT_EQ(store.entries[i], before);
    }
    EXPECT_EQ(store.lists(), "r carl; w");
}

TEST_F(StoreLists, TheOrderOfEntriesStaysBecauseTheFirstThatDecidesCounts) {
    const std::string denyAll =
        "<D:ace><D:principal><D:all/></D:principal><D:deny>" + privilege("read") + "</D:deny></D:ace>";
    const std::string denyStaff = "<D:ace><D:principal><D:href>/principals/staff</D:href></D:principal><D:deny>" +
                                  privilege("read") + "</D:deny></D:ace>";
    const auto order = [this] {
        std::string names;
        for (const std::string& entry : store.entries)
            for (const char* name : {"bob", "carl", "staff", "D:all"})
                if (entry.find(name) != std::string::npos) names += (names.empty() ? "" : " ") + std::string(name);
        return names;
    };
    store.entries = {AclStore::ace("/principals/bob", {"read"}), denyStaff, denyAll};
    ASSERT_EQ(read(), "r bob; w");
    EXPECT_TRUE(set({"bob", "carl"}, {}));
    EXPECT_EQ(order(), "bob staff carl D:all") << "whom all are denied for stands before that";
    EXPECT_TRUE(set({"bob", "carl"}, {"bob"}));
    EXPECT_EQ(order(), "bob staff carl D:all");
    EXPECT_EQ(store.lists(), "r bob carl; w bob");
    EXPECT_TRUE(set({"carl"}, {}));
    EXPECT_EQ(order(), "staff carl D:all");
}

TEST_F(StoreLists, AGrantBehindADenialThatTakesItIsNone) {
    const auto deny = [](const std::string& whom, const std::string& what) {
        return "<D:ace><D:principal>" + whom + "</D:principal><D:deny>" + privilege(what) + "</D:deny></D:ace>";
    };
    const std::string bob = AclStore::ace("/principals/bob", {"read", "write"});
    const std::string toBob = "<D:href>/principals/bob</D:href>", toCarl = "<D:href>/principals/carl</D:href>";
    const auto readAs = [&](const Names& entries) {
        store.entries = entries;
        return read();
    };
    EXPECT_EQ(readAs({deny("<D:all/>", "read"), bob}), "r; w bob");
    EXPECT_EQ(readAs({deny("<D:authenticated/>", "all"), bob}), "r; w");
    EXPECT_EQ(readAs({deny("<D:all/>", "bind"), bob}), "r bob; w");
    EXPECT_EQ(readAs({deny(toBob, "write"), bob}), "r bob; w");
    EXPECT_EQ(readAs({deny(toCarl, "all"), bob}), "r bob; w bob");
    EXPECT_EQ(readAs({deny("<D:unauthenticated/>", "all"), bob}), "r bob; w bob");
    EXPECT_EQ(readAs({bob, deny("<D:all/>", "all")}), "r bob; w bob");
}

TEST_F(StoreLists, AReaderWhoseGrantADenialTakesGetsOneInFrontOfIt) {
    const std::string denyAll =
        "<D:ace><D:principal><D:all/></D:principal><D:deny>" + privilege("read") + "</D:deny></D:ace>";
    store.entries = {denyAll, AclStore::ace("/principals/bob", {"read"}), AclStore::ace("/principals/carl", {"read"})};
    EXPECT_EQ(read(), "r; w");
    EXPECT_TRUE(set({"bob"}, {}));
    ASSERT_EQ(store.entries.size(), 2u) << "a grant that gives nothing to nobody's wish is gone";
    EXPECT_NE(store.entries[0].find("/principals/bob"), std::string::npos);
    EXPECT_EQ(store.lists(), "r bob; w");
}

TEST_F(StoreLists, TheServersOwnEntriesAreNotSentBack) {
    set({"bob"}, {});
    EXPECT_EQ(store.bodies.back().find("protected"), std::string::npos);
    EXPECT_EQ(store.bodies.back().find("owner"), std::string::npos);
}

TEST_F(StoreLists, AreNotSentWhenTheyAreThereAlready) {
    store.entries = {AclStore::ace("/principals/carl", {"read", "write"}), AclStore::ace("/principals/bob", {"read"})};
    EXPECT_TRUE(set({"bob", "carl"}, {"carl"}));
    EXPECT_EQ(store.wire->count("ACL"), 0u);
}

TEST_F(StoreLists, CostNoRequestWhenTheCallerChangedNothing) {
    EXPECT_TRUE(set({"bob"}, {}));
    store.wire->clear();
    EXPECT_TRUE(set({"bob"}, {}));
    EXPECT_EQ(store.wire->methods(), "");
    read();
    store.wire->clear();
    EXPECT_TRUE(set({"bob"}, {}));
    EXPECT_EQ(store.wire->methods(), "") << "what was read is known as well";
}

// The owner has two machines: what one of them withdrew, the other must not grant again with a list that it read
// before.
TEST_F(StoreLists, WhatOthersChangedSinceTheyWereReadStays) {
    store.entries = {AclStore::ace("/principals/bob", {"read", "write"}), AclStore::ace("/principals/carl", {"read"})};
    EXPECT_EQ(read(), "r bob carl; w bob");
    store.entries = {AclStore::ace("/principals/carl", {"read"}), AclStore::ace("/principals/dora", {"read"})};
    store.people["/principals/eve"] = "Eve";
    EXPECT_TRUE(set({"bob", "carl", "eve"}, {"bob"}));
    EXPECT_EQ(store.lists(), "r carl dora eve; w") << "bob stays out, dora stays in";
    EXPECT_TRUE(set({"bob", "eve"}, {"bob"}));
    EXPECT_EQ(store.lists(), "r dora eve; w") << "carl is taken out";
}

TEST_F(StoreLists, ThatCannotBeReadAreNotSet) {
    store.instead = [](const HttpRequest& r) {
        return r.method == "PROPFIND" ? std::optional(answerOf(500)) : std::nullopt;
    };
    EXPECT_FALSE(set({"bob"}, {}));
    EXPECT_EQ(store.wire->count("ACL"), 0u);
}

TEST_F(StoreLists, ARefusalIsLoggedWithTheServersReasonAndTriedAgain) {
    store.setStatus = 403;
    EXPECT_FALSE(set({"bob"}, {}));
    EXPECT_TRUE(log.has("The access list of " + store.base.absoluteString() + " could not be set: 403, no-invert"))
        << log.text();
    store.setStatus = 200;
    EXPECT_TRUE(set({"bob"}, {}));
    EXPECT_EQ(store.lists(), "r bob; w");
}

TEST_F(StoreLists, APartlyRefusedListIsARefusal) {
    store.instead = [](const HttpRequest& r) {
        return r.method == "ACL" ? std::optional(AclStore::multistatus("")) : std::nullopt;
    };
    EXPECT_FALSE(set({"bob"}, {}));
}

// -- one list for a tree

TEST_F(StoreLists, ThatAPlaceInheritsAreReadAndSetWhereTheyBelong) {
    store.rootOfTheOneList = "/dav/alice/";
    store.entries = {AclStore::ace("/principals/bob", {"read"})};
    EXPECT_EQ(read(), "r bob; w");
    EXPECT_TRUE(set({"bob", "carl"}, {"carl"})) << log.text();
    EXPECT_EQ(read(), "r bob carl; w carl");
    EXPECT_TRUE(set({}, {}));
    EXPECT_EQ(read(), "r; w");
    EXPECT_TRUE(set({"bob"}, {})) << "an empty list says where it belongs by the owner's entry";
    EXPECT_EQ(read(), "r bob; w");
}

TEST_F(StoreLists, AListThatIsInheritedFromElsewhereIsNeverSetThere) {
    const auto refused = [this](const std::string& root, const std::string& owner) {
        store.rootOfTheOneList = root;
        store.ownerOfTheRoot = owner;
        store.entries = {AclStore::ace("/principals/bob", {"read"})};
        const bool done = set({"bob", "carl"}, {});
        return !done && store.entries.size() == 1;
    };
    EXPECT_TRUE(refused("/dav/", "/principals/alice")) << "farther away than the parent";
    EXPECT_TRUE(refused("/dav/bob/", "/principals/alice"));
    EXPECT_TRUE(refused("https://elsewhere.example.org/dav/alice/", "/principals/alice"));
    EXPECT_TRUE(refused("/dav/alice/", "/principals/admin")) << "another owner's";
    EXPECT_FALSE(refused("/dav/alice/", "/principals/alice"));
}

TEST_F(StoreLists, InheritedEntriesDoNotCountBesideOwnOnes) {
    store.entries = {
        AclStore::ace("/principals/bob", {"read"}),
        AclStore::ace("/principals/carl", {"write"}, "<D:inherited><D:href>/dav/alice/</D:href></D:inherited>")};
    EXPECT_EQ(read(), "r bob; w");
    EXPECT_TRUE(set({}, {}));
    EXPECT_EQ(store.lists(), "r; w");
}

// -- principals

TEST_F(StoreLists, ANameIsLookedUpInThePrincipalCollection) {
    store.people = {{"/principals/x17", "Bob"}, {"/principals/carl", "The one and only"}};
    EXPECT_TRUE(set({"Bob", "carl"}, {}));
    ASSERT_EQ(store.entries.size(), 2u);
    EXPECT_NE(store.entries[0].find("/principals/x17"), std::string::npos) << store.entries[0];
    EXPECT_NE(store.entries[1].find("/principals/carl"), std::string::npos);
}

// Behind what ends TLS a server knows itself by the inner address, and writes that into its hrefs.
TEST_F(StoreLists, AServerMayCallItselfByAnotherAddress) {
    store.origin = "http://127.0.0.1:8080";
    store.entries = {AclStore::ace("/principals/carl", {"read"})};
    EXPECT_EQ(read(), "r carl; w");
    EXPECT_TRUE(set({"bob", "carl"}, {"bob"}));
    EXPECT_EQ(store.lists(), "r carl bob; w bob");
    EXPECT_EQ(store.wire->text().find("127.0.0.1"), std::string::npos) << "nobody is asked there";
}

TEST_F(StoreLists, AnotherServersPrincipalsAreNobodysHere) {
    store.entries = {AclStore::ace("https://elsewhere.example.org/principals/carl", {"read"}),
                     AclStore::ace("/principals/bob", {"read"})};
    EXPECT_EQ(read(), "r bob; w");
}

TEST_F(StoreLists, WhomTheStoreDoesNotKnowIsLeftOutAndSaid) {
    EXPECT_FALSE(set({"bob", "nobody"}, {"nobody"}));
    EXPECT_EQ(store.lists(), "r bob; w");
    EXPECT_TRUE(log.has("The store knows nobody called \"nobody\": the access list of " + store.base.absoluteString() +
                        " goes without."))
        << log.text();
    store.wire->clear();
    EXPECT_FALSE(set({"bob", "nobody"}, {"nobody"}));
    EXPECT_EQ(store.wire->count("ACL"), 0u) << "the rest is there already";
}

TEST_F(StoreLists, WherePrincipalsDoNotAnswerTheStoreJudgesTheName) {
    store.instead = [](const HttpRequest& r) {
        return r.url.encodedPath().starts_with("/principals") ? std::optional(answerOf(405)) : std::nullopt;
    };
    EXPECT_TRUE(set({"b\u00f6b & <co>"}, {}));
    ASSERT_EQ(store.entries.size(), 1u);
    EXPECT_NE(store.entries[0].find("/principals/b%C3%B6b%20%26%20%3Cco%3E<"), std::string::npos) << store.entries[0];
    store.instead = nullptr;
    EXPECT_EQ(store.lists(), "r b\u00f6b & <co>; w");
}

TEST_F(StoreLists, HostileNamesAreNobody) {
    store.principalsAnswer = false;
    for (const char* name : {"", ".", "..", "a/b", "../alice", "a\nb", "a\\b"}) EXPECT_FALSE(set({name}, {})) << name;
    EXPECT_TRUE(store.entries.empty());
}

TEST_F(StoreLists, CollectionsOfOtherServersAreNotAsked) {
    store.collections = {"https://evil.example.org/principals/", "//evil.example.org/", "mailto:x"};
    EXPECT_FALSE(set({"bob"}, {}));
    EXPECT_EQ(store.wire->methods(), "OPTIONS PROPFIND");
}

TEST_F(StoreLists, AnHrefThatTheStoreWroteItselfIsUsedAgain) {
    store.entries = {AclStore::ace("/principals/by-number/bob", {"read"})};
    EXPECT_TRUE(set({"bob"}, {"bob"}));
    ASSERT_EQ(store.entries.size(), 1u);
    EXPECT_NE(store.entries[0].find("/principals/by-number/bob"), std::string::npos) << store.entries[0];
}

// -- stores without lists

TEST_F(StoreLists, AStoreThatAnnouncesNoneIsAskedForNone) {
    store.announces = "1, 2, access-control-list";
    EXPECT_EQ(store.manager->keepsAccessLists(), false);
    store.wire->clear();
    EXPECT_EQ(read(), "unreadable");
    EXPECT_FALSE(set({"bob"}, {}));
    EXPECT_EQ(store.wire->methods(), "");
}

TEST_F(StoreLists, AStoreThatDoesNotAnswerIsUnknown) {
    store.instead = [](const HttpRequest&) {
        HttpResponse lost;
        lost.error = TransportError::unreachable;
        return std::optional(lost);
    };
    EXPECT_EQ(store.manager->keepsAccessLists(), std::nullopt);
    store.instead = nullptr;
    EXPECT_EQ(store.manager->keepsAccessLists(), true);
}

TEST(PlainStore, KeepsNoAccessListsAndSaysSo) {
    const StoreWorld world(StoreWorld::plain());
    Client alice(world);
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true)) << alice.wire->text();
    EXPECT_EQ(alice.manager.keepsAccessLists(), false);
    Names readers, writers;
    EXPECT_FALSE(alice.manager.ACLsAtURL(alice.base.withScheme("https"), readers, writers));
    EXPECT_FALSE(alice.manager.setACLsWithReadPrincipals({"bob"}, {}, alice.base));
    EXPECT_EQ(alice.wire->count("ACL"), 0u);
    EXPECT_EQ(alice.write("info", Dictionary{{"SerialNumber", "1"}}) / 100, 2) << "publishing works";
}

TEST(PlainStore, AnswersAQueryThatFallsBackFromTheUnboundedDepth) {
    const StoreWorld world(StoreWorld::plain());
    Client alice(world);
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    ASSERT_EQ(alice.write("AllCXGroup", Dictionary()) / 100, 2);
    alice.wire->clear();
    CXDAVQuery query(alice.manager, alice.at("AllCXGroup").withScheme("https"));
    query.setBody("<?xml version=\"1.0\" encoding=\"utf-8\" ?><D:propfind xmlns:D=\"DAV:\"><D:prop>"
                  "<D:current-user-privilege-set/></D:prop></D:propfind>");
    const auto root = query.execute();
    EXPECT_TRUE(query.succeeded()) << alice.wire->text();
    ASSERT_TRUE(root && davResponses(*root));
    EXPECT_EQ(davResponses(*root)->size(), 1u);
    for (const auto& e : alice.wire->exchanges()) EXPECT_TRUE(e.method == "PROPFIND" || e.method == "OPTIONS");
    ASSERT_TRUE(alice.manager.createDirectoryAtAURL(alice.at("AllCXGroup")));
    EXPECT_TRUE(query.execute()) << "a group's directory answers as well: " << alice.wire->text();
}

} // namespace
} // namespace rolvane
