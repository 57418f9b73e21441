#include "AccessWorld.h"

#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <map>
#include <regex>
#include <set>
#include <string>
#include <vector>

namespace rolvane {
namespace {

using testing::HasSubstr;
using testing::Not;

void writeFile(const std::string& path, const std::string& text = "x") {
    std::ofstream(path, std::ios::binary) << text;
}

std::string header(const RawAnswer& answer, const std::string& name) {
    std::smatch found;
    const std::regex line("(^|\r\n)" + name + ": ([^\r\n]*)", std::regex::icase);
    return std::regex_search(answer.headers, found, line) ? found[2].str() : "";
}

// The links of a page, as they stand there.
std::vector<std::string> links(const std::string& page) {
    std::vector<std::string> found;
    const std::regex link("href=\"([^\"]*)\"");
    for (std::sregex_iterator at(page.begin(), page.end(), link), end; at != end; ++at) found.push_back((*at)[1]);
    return found;
}

// Where a client gets by a relative link: "./", "../" and names.
std::string followed(const std::string& page, const std::string& link) {
    std::string base = page.substr(0, page.rfind('/') + 1);
    if (link == "../") return base.substr(0, base.rfind('/', base.size() - 2) + 1);
    EXPECT_EQ(link.rfind("./", 0), 0U) << link;
    return base + link.substr(2);
}

// Everything that is reached by links from the page; the links are followed with HEAD, as crawlers do, and then read.
void walk(const AccessWorld& world, const std::string& user, const std::string& page, std::set<std::string>& seen) {
    if (!seen.insert(page).second) return;
    ASSERT_EQ(world.status(user, "HEAD", page), 200) << page;
    const RawAnswer answer = world.ask(user, "GET", page);
    ASSERT_EQ(answer.status, 200) << page;
    if (header(answer, "Content-Type").rfind("text/html", 0) != 0) return;
    for (const std::string& link : links(answer.body))
        if (link != "../") walk(world, user, followed(page, link), seen);
}

class Index : public testing::Test {
protected:
    Index() { world.reset(); }
    std::string tree() const { return world.store.userDirectory("alice") + "/Contacts"; }
    AccessWorld world;
};

TEST_F(Index, ACollectionIsAPageWithNamesSizesAndDates) {
    std::filesystem::create_directory(tree() + "/People");
    writeFile(tree() + "/info", "12345");
    const RawAnswer page = world.ask("alice", "GET", "/dav/alice/Contacts/");
    EXPECT_EQ(page.status, 200);
    EXPECT_EQ(header(page, "Content-Type"), "text/html; charset=utf-8");
    EXPECT_EQ(header(page, "Content-Length"), std::to_string(page.body.size()));
    EXPECT_EQ(header(page, "Cache-Control"), "private, no-cache");
    EXPECT_EQ(header(page, "Content-Security-Policy"), "sandbox; default-src 'none'");
    EXPECT_EQ(header(page, "X-Content-Type-Options"), "nosniff");
    EXPECT_THAT(page.body, HasSubstr("The published tree of alice / Contacts"));
    EXPECT_THAT(page.body, HasSubstr("<a href=\"./People/\"><bdi>People</bdi>/</a>"));
    EXPECT_THAT(page.body, HasSubstr("<a href=\"./info\"><bdi>info</bdi></a></td><td align=\"right\">5</td><td>20"));
    EXPECT_THAT(page.body, Not(HasSubstr("<script")));
    EXPECT_THAT(page.body, Not(HasSubstr("style")));
    EXPECT_THAT(world.ask("alice", "GET", "/dav/alice/").body, HasSubstr("<h1><bdi>The published tree of alice</bdi>"));
}

TEST_F(Index, HeadTellsTheSameWithoutTheBody) {
    const RawAnswer page = world.ask("alice", "GET", "/dav/alice/Contacts/");
    const RawAnswer head = world.ask("alice", "HEAD", "/dav/alice/Contacts/");
    EXPECT_EQ(head.status, 200);
    EXPECT_EQ(head.body, "");
    for (const char* name : {"Content-Type", "Content-Length", "Cache-Control"})
        EXPECT_EQ(header(head, name), header(page, name)) << name;
}

TEST_F(Index, NamesLeadToTheirFilesWhateverTheyHold) {
    const std::map<std::string, std::string> files{{"a:CXPerson", "./a:CXPerson"},
                                                   {"x<b>&\"'", ""},
                                                   {"100% #1?", ""},
                                                   {"javascript:alert(1)", "./javascript:alert(1)"},
                                                   {"\xc3\xbc \xe5\xad\x97", ""},
                                                   {"\xff\xfe", ""},
                                                   {"line\nbreak", ""}};
    for (const auto& [name, link] : files) writeFile(tree() + "/" + name, "of " + name);
    for (const std::string page : {"/dav/alice/Contacts/", "/dav/alice/Contacts"}) {
        const RawAnswer answer = world.ask("alice", "GET", page);
        ASSERT_EQ(answer.status, 200);
        EXPECT_THAT(answer.body, Not(HasSubstr("<b>")));
        EXPECT_THAT(answer.body, Not(HasSubstr("\xff")));
        EXPECT_THAT(answer.body, Not(HasSubstr("line\nbreak")));
        EXPECT_THAT(answer.body, HasSubstr("<bdi>x&lt;b&gt;&amp;&quot;'</bdi>"));
        std::set<std::string> read;
        for (const std::string& link : links(answer.body)) {
            if (link == "../" || link == "./") continue;
            std::string plain = std::regex_replace(link, std::regex("&amp;"), "&");
            plain = std::regex_replace(plain, std::regex("&quot;"), "\"");
            read.insert(world.ask("alice", "GET", followed(page, plain)).body);
        }
        for (const auto& [name, link] : files) {
            EXPECT_TRUE(read.contains("of " + name)) << page << ": " << name;
        }
    }
}

TEST_F(Index, OnlyWhoMayReadSeesItAndOnlyWhatTheyMayRead) {
    writeFile(tree() + "/info");
    EXPECT_EQ(world.status("rita", "GET", "/dav/alice/Contacts/"), 200);
    EXPECT_EQ(world.status("sam", "GET", "/dav/alice/Contacts/"), 403);
    EXPECT_EQ(world.status("sam", "HEAD", "/dav/alice/Contacts/"), 403);
    EXPECT_EQ(world.status("", "GET", "/dav/alice/Contacts/"), 401);
    // The base shows to each the trees that they may read, as a listing does.
    writeFile(world.store.userDirectory("alice") + "/secret");
    const RawAnswer base = world.ask("sam", "GET", "/dav/");
    EXPECT_EQ(base.status, 200);
    EXPECT_THAT(base.body, HasSubstr("./sam/"));
    EXPECT_THAT(base.body, Not(HasSubstr("alice")));
}

TEST_F(Index, ShowsNeitherTheServersOwnFilesNorSymbolicLinks) {
    writeFile(tree() + "/.htaccess");
    std::filesystem::create_directory(tree() + "/.DAV");
    std::filesystem::create_symlink("/etc/passwd", tree() + "/link");
    const std::string page = world.ask("alice", "GET", "/dav/alice/Contacts/").body;
    for (const char* name : {".htaccess", ".DAV", "link\""}) EXPECT_THAT(page, Not(HasSubstr(name)));
}

TEST_F(Index, ATreeIsWalkedByItsLinksAlone) {
    std::filesystem::create_directories(tree() + "/Pe ople/1f");
    writeFile(tree() + "/Pe ople/1f/B:CXPerson");
    writeFile(tree() + "/info");
    std::set<std::string> seen;
    walk(world, "rita", "/dav/alice/Contacts/", seen);
    EXPECT_TRUE(seen.contains("/dav/alice/Contacts/Pe%20ople/1f/B:CXPerson")) << testing::PrintToString(seen);
    EXPECT_TRUE(seen.contains("/dav/alice/Contacts/info"));
}

TEST_F(Index, APageIsBoundedAndTellsHowManyItDoesNotShow) {
    for (int i = 0; i < 10003; ++i) writeFile(tree() + "/" + std::to_string(100000 + i));
    const RawAnswer page = world.ask("alice", "GET", "/dav/alice/Contacts/");
    EXPECT_EQ(page.status, 200);
    EXPECT_EQ(links(page.body).size(), 10001U) << "10,000 members, and the way up";
    EXPECT_THAT(page.body, HasSubstr("./109999\""));
    EXPECT_THAT(page.body, Not(HasSubstr("./110000\"")));
    EXPECT_THAT(page.body, HasSubstr("Not shown are "));
    EXPECT_LT(page.body.size(), 2000000U);
}

// What a browser makes of it: links that resolve, and a text that reads.
TEST_F(Index, ATextBrowserReadsIt) {
    writeFile(tree() + "/info", "12345");
    const CommandResult seen = runCommand({"w3m", "-dump", "-T", "text/html", "-cols", "100"},
                                          world.ask("alice", "GET", "/dav/alice/Contacts/").body);
    EXPECT_EQ(seen.status, 0) << seen.errors;
    EXPECT_THAT(seen.output, HasSubstr("The published tree of alice / Contacts"));
    EXPECT_THAT(seen.output, testing::ContainsRegex("info +5 20"));
}

// The module with sanitizers meets the same names.
TEST(IndexSanitized, TakesEveryNameThere) {
    AccessWorld world(AccessVariant::sanitized);
    world.reset();
    const std::string tree = world.store.userDirectory("alice") + "/Contacts";
    for (const char* name : {"\xff", "\xc3", "\xe2\x80", "\xf0\x9f", "%", "a&b", "\x7f"}) writeFile(tree + "/" + name);
    EXPECT_EQ(world.status("alice", "GET", "/dav/alice/Contacts"), 200);
    EXPECT_EQ(world.status("alice", "GET", "/dav/"), 200);
}

} // namespace
} // namespace rolvane
