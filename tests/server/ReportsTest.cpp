#include "AccessWorld.h"
#include "foundation/Paths.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace rolvane {
namespace {

using testing::AllOf;
using testing::HasSubstr;
using testing::Not;

constexpr const char* kTree = "/dav/alice/Contacts/";
constexpr const char* kEvery[] = {"expand-property", "acl-principal-prop-set", "principal-match",
                                  "principal-property-search", "principal-search-property-set"};

// One store for the tests of this file.
class Reports : public testing::Test {
protected:
    static void SetUpTestSuite() {
        world = std::make_unique<AccessWorld>();
        world->reset();
    }
    static void TearDownTestSuite() { world.reset(); }

    static RawAnswer report(const std::string& user, const std::string& path, const std::string& name,
                            const std::string& content, std::vector<std::pair<std::string, std::string>> headers = {}) {
        return world->ask(user, "REPORT", path, std::move(headers),
                          "<?xml version=\"1.0\"?><D:" + name + " xmlns:D=\"DAV:\">" + content + "</D:" + name + ">");
    }
    static std::string body(const RawAnswer& answer, int status = 207) {
        EXPECT_EQ(answer.status, status) << answer.headers << answer.body;
        return answer.body;
    }
    static std::string search(const std::string& match) {
        return "<D:property-search><D:prop><D:displayname/></D:prop><D:match>" + match +
               "</D:match></D:property-search><D:prop><D:displayname/></D:prop>";
    }
    static std::unique_ptr<AccessWorld> world;
};
std::unique_ptr<AccessWorld> Reports::world;

TEST_F(Reports, AreListedOnTreesAndPrincipals) {
    for (const char* path : {kTree, "/principals/users/rita", "/principals/"}) {
        const std::string shown =
            body(world->ask("rita", "PROPFIND", path, {{"Depth", "0"}}, AccessWorld::propfind("supported-report-set")));
        for (const char* name : kEvery) {
            const bool of = path == std::string(kTree) || name != std::string("acl-principal-prop-set");
            EXPECT_EQ(shown.find(std::string("<D:report><D:") + name + "/>") != std::string::npos, of) << name << path;
        }
    }
}

TEST_F(Reports, AclPrincipalPropSetIsForWhoMayReadTheList) {
    const std::string props = "<D:prop><D:displayname/><D:group-member-set/></D:prop>";
    const std::string text = body(report("alice", kTree, "acl-principal-prop-set", props));
    for (const char* href : {"users/alice", "users/walter", "users/rita", "groups/readers"})
        EXPECT_THAT(text, HasSubstr("<D:href>/principals/" + std::string(href) + "</D:href>"));
    EXPECT_THAT(text, HasSubstr("<D:displayname>readers</D:displayname>"));
    EXPECT_THAT(text, Not(HasSubstr("greta"))) << "who is in the group is not alice's business";
    for (const char* user : {"walter", "rita", "greta"}) {
        const RawAnswer refused = report(user, kTree, "acl-principal-prop-set", props);
        EXPECT_EQ(refused.status, 403);
        EXPECT_EQ(refused.precondition(), "need-privileges");
        EXPECT_THAT(refused.body, Not(HasSubstr("users/")));
    }
    EXPECT_EQ(report("sam", kTree, "acl-principal-prop-set", props).status, 403);
    EXPECT_EQ(report("", kTree, "acl-principal-prop-set", props).status, 401);
}

TEST_F(Reports, PrincipalMatchFindsTheUserAndTheUsersGroups) {
    const std::string self = "<D:self/><D:prop><D:displayname/></D:prop>";
    const std::string all = body(report("greta", "/principals/", "principal-match", self));
    EXPECT_THAT(all, AllOf(HasSubstr("/principals/users/greta<"), HasSubstr("/principals/groups/readers<"),
                           Not(HasSubstr("others")), Not(HasSubstr("sam"))));
    EXPECT_THAT(body(report("greta", "/principals/groups/", "principal-match", self)),
                AllOf(HasSubstr("/principals/groups/readers<"), Not(HasSubstr("users/greta<"))));
    EXPECT_THAT(body(report("greta", "/principals/", "principal-match",
                            "<D:principal-property><D:group-member-set/></D:principal-property>")),
                AllOf(HasSubstr("/principals/groups/readers<"), Not(HasSubstr("users/greta<"))));
    EXPECT_EQ(report("greta", "/principals/", "principal-match", "").status, 400);
    EXPECT_EQ(report("greta", "/principals/", "principal-match", self, {{"Depth", "1"}}).status, 400);
}

TEST_F(Reports, PrincipalMatchFindsWhatTheUserOwns) {
    const std::string owner =
        "<D:principal-property><D:owner/></D:principal-property><D:prop><D:getetag/><D:owner/></D:prop>";
    for (const char* path : {"/dav/", "/dav/alice/"}) {
        const std::string own = body(report("alice", path, "principal-match", owner));
        EXPECT_THAT(own, AllOf(HasSubstr("<D:href>/dav/alice/</D:href>"), HasSubstr("/People/7/1:CXPerson</D:href>"),
                               HasSubstr("getetag>"), Not(HasSubstr("/dav/sam"))));
    }
    EXPECT_THAT(body(report("walter", kTree, "principal-match", owner)), Not(HasSubstr("<D:href>")));
    EXPECT_THAT(body(report("walter", "/dav/", "principal-match", owner)), Not(HasSubstr("/dav/alice")));
}

TEST_F(Reports, APropertySearchFindsNobodyWhoIsNotNamedWhole) {
    const auto found = [&](const std::string& user, const std::string& match) {
        return body(report(user, "/principals/", "principal-property-search", search(match)));
    };
    EXPECT_THAT(found("sam", "greta"), HasSubstr("<D:href>/principals/users/greta</D:href>"));
    EXPECT_THAT(found("sam", "readers"), HasSubstr("<D:href>/principals/groups/readers</D:href>"));
    EXPECT_THAT(found("sam", "SA"), HasSubstr("<D:href>/principals/users/sam</D:href>")) << "oneself by a part";
    EXPECT_THAT(found("greta", "read"), HasSubstr("/principals/groups/readers<")) << "a group of one's own";
    for (const char* part : {"gret", "a", "read", "nobody", "..", "GRETA"})
        EXPECT_THAT(found("sam", part),
                    AllOf(Not(HasSubstr("greta")), Not(HasSubstr("readers")), Not(HasSubstr("alice"))))
            << part;
    EXPECT_THAT(body(report("sam", "/principals/users/", "principal-property-search", search("readers"))),
                Not(HasSubstr("<D:href>")));
    EXPECT_THAT(body(report("sam", "/dav/sam/", "principal-property-search",
                            search("greta") + "<D:apply-to-principal-collection-set/>")),
                HasSubstr("/principals/users/greta<"));
    EXPECT_THAT(body(report("sam", "/dav/sam/", "principal-property-search", search("greta"))),
                Not(HasSubstr("<D:href>")));
    std::string many;
    for (int i = 0; i < 17; ++i) many += search("x" + std::to_string(i));
    EXPECT_EQ(report("sam", "/principals/", "principal-property-search", many).precondition(),
              "number-of-matches-within-limits");
    EXPECT_EQ(report("sam", "/principals/", "principal-property-search", search("")).status, 400);
    EXPECT_THAT(body(report("sam", "/principals/", "principal-search-property-set", ""), 200),
                HasSubstr("<D:principal-search-property><D:prop><D:displayname/></D:prop>"));
}

TEST_F(Reports, ExpandPropertyTellsOfPrincipalsWhatPropfindTells) {
    const std::string who = "<D:property name=\"current-user-principal\"><D:property name=\"displayname\"/>"
                            "<D:property name=\"group-membership\"><D:property name=\"displayname\"/></D:property>"
                            "</D:property><D:property name=\"owner\"/><D:property name=\"getetag\"/>"
                            "<D:property name=\"none\" namespace=\"urn:x\"/>";
    const std::string text = body(report("greta", "/dav/alice/Contacts/dateFile", "expand-property", who));
    EXPECT_THAT(text, HasSubstr("<D:current-user-principal><D:response>"));
    EXPECT_THAT(text,
                AllOf(HasSubstr("<D:displayname>greta</D:displayname>"), HasSubstr("<D:group-membership><D:response>"),
                      HasSubstr("<D:displayname>readers<"), HasSubstr("getetag>"), HasSubstr("404 Not Found")));
    EXPECT_THAT(text, HasSubstr("<D:owner><D:href>/principals/users/alice</D:href></D:owner>"));
    const std::string members = "<D:property name=\"acl\"><D:property name=\"displayname\"/><D:property "
                                "name=\"group-member-set\"/></D:property>";
    EXPECT_THAT(body(report("alice", kTree, "expand-property", members)),
                AllOf(HasSubstr("<D:displayname>walter</D:displayname>"), Not(HasSubstr("greta"))));
    EXPECT_THAT(body(report("rita", kTree, "expand-property", members)), Not(HasSubstr("walter")));
    EXPECT_THAT(body(report("sam", "/principals/users/greta", "expand-property",
                            "<D:property name=\"group-membership\"><D:property name=\"displayname\"/></D:property>"
                            "<D:property name=\"principal-URL\"><D:property name=\"displayname\"/></D:property>")),
                AllOf(HasSubstr("<D:displayname>greta<"), Not(HasSubstr("readers"))));
    EXPECT_EQ(report("sam", kTree, "expand-property", members).status, 403);
}

TEST_F(Reports, ExpandPropertyQuotesTheNamespacesThatItIsAskedFor) {
    for (const char* path : {"/dav/alice/Contacts/dateFile", "/principals/users/greta"}) {
        const std::string text =
            body(report("greta", path, "expand-property",
                        "<D:property name=\"none\" namespace=\"urn:&quot;/&gt;&lt;y&gt;&amp;z\"/>"));
        EXPECT_THAT(text, AllOf(HasSubstr("urn:&quot;/&gt;&lt;y&gt;&amp;z"), Not(HasSubstr("urn:\""))));
    }
}

TEST_F(Reports, NamesStandInAnswersAsTheyWereAskedFor) {
    const std::string quoted = "<D:prop><x xmlns=\"urn:a&amp;b\"/></D:prop>", twoColons = "<D:prop><D:a:b/></D:prop>";
    const auto find = [](const std::string& prop) {
        return world->ask("rita", "PROPFIND", "/principals/users/rita", {{"Depth", "0"}},
                          "<D:propfind xmlns:D=\"DAV:\">" + prop + "</D:propfind>");
    };
    const auto match = [](const std::string& prop) {
        return report("rita", "/principals/", "principal-match", "<D:self/>" + prop);
    };
    EXPECT_THAT(body(match(quoted)), HasSubstr("xmlns=\"urn:a&amp;b\""));
    EXPECT_THAT(body(find(quoted)), HasSubstr("xmlns=\"urn:a&amp;b\""));
    EXPECT_EQ(match(twoColons).status, 400);
    EXPECT_EQ(find(twoColons).status, 400);
    EXPECT_EQ(report("rita", kTree, "sync-collection", "<D:sync-token/>" + twoColons).status, 400);
}

TEST_F(Reports, ExpandPropertyHasBounds) {
    std::string deep = "<D:property name=\"displayname\"/>";
    for (int i = 0; i < 9; ++i) deep = "<D:property name=\"principal-URL\">" + deep + "</D:property>";
    EXPECT_EQ(report("sam", "/principals/users/sam", "expand-property", deep).precondition(),
              "number-of-matches-within-limits");
    std::string wide = "<D:property name=\"displayname\"/>";
    for (int i = 0; i < 3; ++i) {
        std::string next;
        for (int k = 0; k < 20; ++k) next += "<D:property name=\"principal-URL\">" + wide + "</D:property>";
        wide = next;
    }
    EXPECT_EQ(report("sam", "/principals/users/sam", "expand-property", wide).precondition(),
              "number-of-matches-within-limits");
    for (const char* name : {"", "a b", "&lt;x/&gt;", "9", "a:b"})
        EXPECT_EQ(report("sam", "/principals/users/sam", "expand-property",
                         "<D:property name=\"" + std::string(name) + "\"/>")
                      .status,
                  400)
            << name;
}

TEST_F(Reports, OthersAreRefusedByName) {
    EXPECT_EQ(report("sam", "/principals/users/sam", "sync-collection", "").precondition(), "supported-report");
    EXPECT_EQ(report("sam", "/principals/users/nobody", "expand-property", "").status, 404);
    EXPECT_EQ(report("", "/principals/users/sam", "expand-property", "").status, 401);
    EXPECT_EQ(world->status("sam", "REPORT", "/principals/users/sam", {}, "<not well formed"), 400);
    EXPECT_EQ(world->status("sam", "REPORT", "/principals/users/sam", {}, ""), 400);
}

TEST_F(Reports, OfTheBaseShowNoTreesOfOthers) {
    for (const char* name : kEvery) {
        const RawAnswer answer =
            report("sam", "/dav/", name,
                   "<D:self/><D:prop><D:displayname/></D:prop><D:property name=\"acl\"><D:property "
                   "name=\"displayname\"/></D:property>");
        EXPECT_THAT(answer.body, Not(HasSubstr("alice"))) << name;
    }
    EXPECT_EQ(report("sam", "/dav/", "principal-match", "<D:self/>", {{"Depth", "infinity"}}).status, 403);
}

// -- principals

TEST_F(Reports, PrincipalsHaveAnOwnerAndAListThatTheySeeThemselves) {
    const auto shown = [&](const std::string& user, const std::string& path) {
        return body(world->ask(user, "PROPFIND", path, {{"Depth", "0"}},
                               AccessWorld::propfind("owner acl current-user-privilege-set inherited-acl-set")));
    };
    EXPECT_THAT(shown("sam", "/principals/users/sam"),
                AllOf(HasSubstr("<D:owner><D:href>/principals/users/sam</D:href></D:owner>"),
                      HasSubstr("<D:principal><D:self/></D:principal>"), HasSubstr("<D:read-acl/>")));
    EXPECT_THAT(shown("greta", "/principals/groups/readers"), HasSubstr("<D:self/>"));
    EXPECT_THAT(shown("sam", "/principals/groups/readers"),
                AllOf(Not(HasSubstr("<D:self/>")), HasSubstr("<D:owner/>")));
    EXPECT_THAT(shown("sam", "/principals/users/greta"),
                AllOf(Not(HasSubstr("<D:self/>")), Not(HasSubstr("read-acl"))));
}

TEST_F(Reports, APrincipalIsASmallPageToWhoLooksAtIt) {
    const RawAnswer own = world->ask("greta", "GET", "/principals/users/greta");
    EXPECT_EQ(own.status, 200);
    EXPECT_THAT(own.headers, AllOf(HasSubstr("text/html"), HasSubstr("Content-Security-Policy: default-src 'none'")));
    EXPECT_THAT(own.body, AllOf(HasSubstr("<h1>User greta</h1>"), HasSubstr("/principals/groups/readers\">readers<")));
    EXPECT_THAT(world->ask("sam", "GET", "/principals/users/greta").body, Not(HasSubstr("readers")));
    EXPECT_THAT(world->ask("sam", "GET", "/principals/users/").body, AllOf(HasSubstr("sam"), Not(HasSubstr("greta"))));
    EXPECT_EQ(world->ask("sam", "HEAD", "/principals/users/sam").body, "");
    EXPECT_EQ(world->status("sam", "GET", "/principals/users/nobody"), 404);
    EXPECT_EQ(world->status("", "GET", "/principals/users/sam"), 401);
    const std::string groups = world->store.stateDirectory() + "/conf/groups";
    const std::string before = readFile(groups);
    writeFileDurably(groups, "<b>\"&: sam\n", 0644);
    const std::string odd = world->ask("sam", "GET", "/principals/users/sam").body;
    EXPECT_THAT(odd, AllOf(HasSubstr("&lt;b&gt;&quot;&amp;</a>"), Not(HasSubstr("<b>"))));
    EXPECT_THAT(world->ask("sam", "GET", "/principals/groups/%3Cb%3E%22&").body, Not(HasSubstr("<b>")));
    writeFileDurably(groups, before, 0644);
}

TEST(ReportsSanitized, AreAnsweredWithoutAFault) {
    AccessWorld world(AccessVariant::sanitized);
    world.reset();
    for (const char* path :
         {"/dav/", "/dav/alice/", "/dav/alice/Contacts/dateFile", "/principals/", "/principals/users/alice"})
        for (const char* name : kEvery)
            for (const std::string& content :
                 {std::string(), std::string("<D:self/><D:prop><D:displayname/><x xmlns=\"urn:y\"/></D:prop>"),
                  std::string("<D:principal-property><D:owner/></D:principal-property><D:prop><D:getetag/></D:prop>"),
                  std::string("<D:property-search><D:prop><D:displayname/></D:prop><D:match>rita</D:match>"
                              "</D:property-search>"),
                  std::string("<D:property name=\"acl\"><D:property name=\"owner\"/></D:property><D:property "
                              "name=\"x\" namespace=\"urn:y\"/>")}) {
                const int status =
                    world.status("alice", "REPORT", path, {},
                                 "<D:" + std::string(name) + " xmlns:D=\"DAV:\">" + content + "</D:" + name + ">");
                EXPECT_TRUE(status == 200 || status == 207 || status == 400 || status == 403) << status << path << name;
            }
    EXPECT_EQ(world.status("alice", "OPTIONS", "/dav/alice/", {},
                           "<D:options xmlns:D=\"DAV:\"><D:activity-collection-set/></D:options>"),
              200);
}

} // namespace
} // namespace rolvane
