#include "AccessWorld.h"

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

namespace rolvane {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::Not;
namespace fs = std::filesystem;

constexpr const char* kTree = "/dav/alice/Contacts/";

// One store for the tests of this file.
class SyncCollection : public testing::Test {
protected:
    static void SetUpTestSuite() { world = std::make_unique<AccessWorld>(); }
    static void TearDownTestSuite() { world.reset(); }
    void SetUp() override { world->reset(); }

    struct Sync {
        int status = 0;
        std::string token, precondition, body;
        std::vector<std::string> changes; // "+path" or "-path" below the base, sorted
        bool isCut = false;
    };
    static std::string bodyOf(const std::string& token, const std::string& level, size_t limit) {
        return "<?xml version=\"1.0\"?><D:sync-collection xmlns:D=\"DAV:\"><D:sync-token>" + token +
               "</D:sync-token><D:sync-level>" + level + "</D:sync-level>" +
               (limit ? "<D:limit><D:nresults>" + std::to_string(limit) + "</D:nresults></D:limit>" : "") +
               "<D:prop><D:getetag/><D:resourcetype/></D:prop></D:sync-collection>";
    }
    static std::string between(const std::string& text, const std::string& start, const std::string& end,
                               size_t from = 0) {
        const size_t at = text.find(start, from);
        if (at == std::string::npos) return {};
        return text.substr(at + start.size(), text.find(end, at) - at - start.size());
    }
    static Sync sync(const std::string& user, const std::string& token, const std::string& level = "infinite",
                     const std::string& path = kTree, size_t limit = 0) {
        const RawAnswer answer = world->ask(user, "REPORT", path, {}, bodyOf(token, level, limit));
        Sync out{answer.status,
                 between(answer.body, "<D:sync-token>", "</D:sync-token>"),
                 answer.precondition(),
                 answer.body,
                 {},
                 false};
        for (size_t at = 0; (at = answer.body.find("<D:response", at)) != std::string::npos; ++at) {
            const std::string response = answer.body.substr(at, answer.body.find("</D:response>", at) - at);
            const std::string href = between(response, "<D:href>", "</D:href>");
            if (response.find(" 507 ") != std::string::npos) {
                out.isCut = true;
                EXPECT_EQ(href, path);
                EXPECT_THAT(response, HasSubstr("number-of-matches-within-limits"));
                continue;
            }
            const bool isGone = response.find("<D:status>HTTP/1.1 404") != std::string::npos &&
                                response.find("propstat") == std::string::npos;
            if (!isGone) {
                EXPECT_THAT(response, HasSubstr(href.ends_with('/') ? "<D:collection/>" : "getetag>")) << href;
            }
            out.changes.push_back((isGone ? "-" : "+") + href.substr(4));
        }
        std::sort(out.changes.begin(), out.changes.end());
        return out;
    }
    // What was told because it is young, and not because it has changed since, goes.
    static std::vector<std::string> newOf(const std::string& user, const std::string& token,
                                          const std::string& level = "infinite", const std::string& path = kTree) {
        const Sync answer = sync(user, token, level, path);
        EXPECT_EQ(answer.status, 207) << answer.body;
        return answer.changes;
    }
    // Every file of the store is older than the file system's clock is coarse.
    static void settle() {
        const auto settled = [] {
            timespec now{};
            clock_gettime(CLOCK_REALTIME, &now);
            for (const auto& entry : fs::recursive_directory_iterator(files())) {
                struct stat s {};
                if (stat(entry.path().c_str(), &s) == 0 &&
                    std::max(s.st_ctim.tv_sec, s.st_mtim.tv_sec) + 4 >= now.tv_sec)
                    return false;
            }
            return true;
        };
        while (!settled()) usleep(50000);
    }
    static fs::path files() { return world->store.stateDirectory() + "/root/dav"; }
    static std::string propertyToken(const std::string& user, const std::string& path = kTree) {
        return between(world->ask(user, "PROPFIND", path, {{"Depth", "0"}}, AccessWorld::propfind("sync-token")).body,
                       "<D:sync-token>", "</D:sync-token>");
    }
    static std::unique_ptr<AccessWorld> world;
};
std::unique_ptr<AccessWorld> SyncCollection::world;

} // namespace

TEST_F(SyncCollection, IsAnnounced) {
    for (const char* path : {kTree, "/dav/alice/", "/dav/alice/Contacts/People/7/"})
        EXPECT_THAT(
            world->ask("alice", "PROPFIND", path, {{"Depth", "0"}}, AccessWorld::propfind("supported-report-set")).body,
            HasSubstr("<D:report><D:sync-collection/>"))
            << path;
    for (const char* path : {"/dav/alice/Contacts/dateFile", "/dav/", "/principals/users/alice"})
        EXPECT_THAT(
            world->ask("alice", "PROPFIND", path, {{"Depth", "0"}}, AccessWorld::propfind("supported-report-set")).body,
            Not(HasSubstr("sync-collection")))
            << path;
    EXPECT_THAT(propertyToken("rita"), HasSubstr("urn:x-rolvane:tree:"));
    EXPECT_THAT(world->ask("rita", "PROPFIND", kTree, {{"Depth", "0"}}).body, Not(HasSubstr("sync-token")))
        << "allprop does not have it";
}

TEST_F(SyncCollection, TellsWhatRequestsHaveChanged) {
    const Sync all = sync("rita", "");
    ASSERT_EQ(all.status, 207) << all.body;
    const std::vector<std::string> people = {"+/alice/Contacts/People/", "+/alice/Contacts/People/7/",
                                             "+/alice/Contacts/People/7/1:CXPerson"};
    EXPECT_THAT(all.changes,
                ElementsAre("+/alice/Contacts/1:CXGroup", people[0], people[1], people[2], "+/alice/Contacts/dateFile",
                            "+/alice/Contacts/locked/", "+/alice/Contacts/locked/file"));
    EXPECT_THAT(sync("rita", "", "1").changes, ElementsAre("+/alice/Contacts/1:CXGroup", people[0],
                                                           "+/alice/Contacts/dateFile", "+/alice/Contacts/locked/"));
    settle();
    std::string token = propertyToken("rita");
    const std::string flat = sync("rita", token, "1").token;
    EXPECT_EQ(sync("rita", token).token, token) << "nothing new is the same token";
    struct Case {
        std::string method, path, destination;
        std::vector<std::string> changes;
    };
    const std::string t = "/dav/alice/Contacts/";
    for (const auto& [method, path, destination, changes] : std::vector<Case>{
             {"PUT", "People/7/2:CXPerson", "", {people[1], "+/alice/Contacts/People/7/2:CXPerson"}},
             {"PUT", "dateFile", "", {"+/alice/Contacts/dateFile"}},
             {"COPY",
              "People/7",
              "People/8",
              {people[0], "+/alice/Contacts/People/8/", "+/alice/Contacts/People/8/1:CXPerson",
               "+/alice/Contacts/People/8/2:CXPerson"}},
             {"MOVE",
              "People/8/1:CXPerson",
              "People/8/3 & 4",
              {"+/alice/Contacts/People/8/", "+/alice/Contacts/People/8/3%20&amp;%204",
               "-/alice/Contacts/People/8/1:CXPerson"}},
             {"DELETE", "People/8", "", {people[0], "-/alice/Contacts/People/8"}},
             {"MKCOL", "2:CXGroup", "", {"+/alice/Contacts/2:CXGroup/"}},
             {"MOVE", "2:CXGroup", "3:CXGroup", {"+/alice/Contacts/3:CXGroup/", "-/alice/Contacts/2:CXGroup"}}}) {
        std::vector<std::pair<std::string, std::string>> headers;
        if (!destination.empty()) {
            std::string escaped = destination;
            for (size_t at; (at = escaped.find(' ')) != std::string::npos;) escaped.replace(at, 1, "%20");
            headers.emplace_back("Destination", t + escaped);
        }
        const int status = world->status("walter", method, t + path, headers, method == "PUT" ? "new" : "");
        ASSERT_TRUE(status == 201 || status == 204) << method << " " << path << " " << status;
        const Sync after = sync("rita", token);
        std::vector<std::string> expected = changes;
        std::sort(expected.begin(), expected.end());
        // What is young is told again.
        EXPECT_THAT(after.changes, testing::IsSupersetOf(expected)) << method << path;
        const auto departures = [](std::vector<std::string> in) {
            std::erase_if(in, [](const std::string& each) { return each.front() == '+'; });
            return in;
        };
        EXPECT_EQ(departures(after.changes), departures(expected));
        token = after.token;
    }
    EXPECT_THAT(newOf("rita", flat, "1"), ElementsAre("+/alice/Contacts/3:CXGroup/", people[0],
                                                      "+/alice/Contacts/dateFile", "-/alice/Contacts/2:CXGroup"));
}

TEST_F(SyncCollection, TellsWhatWasChangedBehindItsBack) {
    settle();
    const std::string token = propertyToken("rita");
    std::ofstream(files() / "alice/Contacts/People/7/1:CXPerson", std::ios::in) << "P";
    EXPECT_THAT(newOf("rita", token), ElementsAre("+/alice/Contacts/People/7/1:CXPerson"));
    fs::remove(files() / "alice/Contacts/1:CXGroup");
    EXPECT_THAT(newOf("rita", token),
                ElementsAre("+/alice/Contacts/People/7/1:CXPerson", "-/alice/Contacts/1:CXGroup"));
}

TEST_F(SyncCollection, TokensOutliveTheServer) {
    settle();
    const std::string token = propertyToken("rita");
    world->store.stop();
    world->store.start();
    EXPECT_EQ(sync("rita", token).token, token);
    world->ask("alice", "PUT", std::string(kTree) + "new", {}, "new");
    world->store.stop();
    world->store.start();
    EXPECT_THAT(newOf("rita", token), ElementsAre("+/alice/Contacts/new"));
}

TEST_F(SyncCollection, ComesInPages) {
    for (int i = 0; i < 10; ++i) world->ask("alice", "PUT", kTree + ("n" + std::to_string(i)), {}, "new");
    settle();
    const Sync all = sync("rita", "");
    EXPECT_FALSE(all.isCut);
    for (const size_t limit : {1, 2, 5, 16}) {
        std::vector<std::string> gathered;
        Sync page{207, "", "", "", {}, true};
        while (page.isCut) {
            page = sync("rita", page.token, "infinite", kTree, limit);
            ASSERT_EQ(page.status, 207) << page.body;
            ASSERT_LE(page.changes.size(), limit);
            gathered.insert(gathered.end(), page.changes.begin(), page.changes.end());
        }
        std::sort(gathered.begin(), gathered.end());
        EXPECT_EQ(gathered, all.changes) << limit;
        EXPECT_THAT(newOf("rita", page.token), IsEmpty());
    }
}

TEST_F(SyncCollection, RefusesWhatIsWrong) {
    const std::string token = propertyToken("rita");
    for (const std::string& bad : {std::string("x"), std::string("urn:x-rolvane:tree:d:1:2:3:4"), token + "0:"}) {
        const Sync refused = sync("rita", bad);
        EXPECT_EQ(refused.status, 403) << bad;
        EXPECT_EQ(refused.precondition, "valid-sync-token") << bad;
    }
    EXPECT_EQ(sync("alice", token, "infinite", "/dav/alice/").precondition, "valid-sync-token") << "of another place";
    EXPECT_EQ(sync("rita", sync("rita", "", "1").token).precondition, "valid-sync-token") << "of a smaller depth";
    EXPECT_EQ(sync("rita", "", "2").status, 400);
    EXPECT_EQ(sync("alice", "", "infinite", "/dav/alice/Contacts/dateFile").precondition, "supported-report");
    EXPECT_EQ(sync("alice", "", "infinite", "/dav/").precondition, "supported-report");
    EXPECT_EQ(sync("sam", "").status, 403);
    EXPECT_EQ(sync("", "").status, 401);
    EXPECT_EQ(world->status("rita", "REPORT", kTree, {{"Depth", "1"}}, bodyOf("", "1", 0)), 400);
    for (const char* content :
         {"", "<D:sync-token/><D:sync-level>1</D:sync-level>", "<D:sync-level>1</D:sync-level><D:prop/>",
          "<D:sync-token/><D:sync-level>1</D:sync-level><D:limit><D:nresults>0</D:nresults></D:limit><D:prop/>"})
        EXPECT_EQ(world->status("rita", "REPORT", kTree, {},
                                std::string("<D:sync-collection xmlns:D=\"DAV:\">") + content + "</D:sync-collection>"),
                  400)
            << content;
}

// Who may read alice's home and not her Contacts gets nothing of them, and is told when that changes.
TEST_F(SyncCollection, RightsDecideWhatIsTold) {
    const auto user = [](const char* name) { return AccessWorld::user(name); };
    const auto may = [&](const char* path, const std::string& aces) {
        EXPECT_EQ(world->status("alice", "ACL", path, {}, AccessWorld::acl(aces)), 200);
    };
    may("/dav/alice/", AccessWorld::ace(user("rita"), "read"));
    const auto denied = "<D:ace><D:principal>" + user("rita") +
                        "</D:principal><D:deny><D:privilege><D:read/></D:privilege></D:deny></D:ace>";
    const std::string open = sync("rita", "", "infinite", "/dav/alice/").token;
    may(kTree, denied);
    EXPECT_EQ(sync("rita", open, "infinite", "/dav/alice/").precondition, "valid-sync-token");
    const Sync without = sync("rita", "", "infinite", "/dav/alice/");
    EXPECT_THAT(without.changes, ElementsAre("+/alice/own"));
    world->ask("alice", "PUT", std::string(kTree) + "secret", {}, "secret");
    settle();
    const Sync quiet = sync("rita", without.token, "infinite", "/dav/alice/");
    EXPECT_EQ(quiet.status, 207);
    EXPECT_THAT(quiet.body, Not(HasSubstr("Contacts")));
    EXPECT_EQ(sync("rita", open).status, 403);
    may(kTree, "");
    EXPECT_EQ(sync("rita", quiet.token, "infinite", "/dav/alice/").precondition, "valid-sync-token");
    EXPECT_THAT(sync("rita", "", "infinite", "/dav/alice/").body, HasSubstr("/Contacts/secret"));
    const std::string token = propertyToken("rita");
    may(kTree, AccessWorld::ace(user("walter"), "read write"));
    EXPECT_EQ(sync("rita", token).status, 207) << "a list that takes nothing away leaves tokens as they are";
}

} // namespace rolvane
