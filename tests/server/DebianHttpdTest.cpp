#include "support/DebianHttpd.h"
#include "AccessWorld.h"
#include "RawHttp.h"
#include "foundation/Paths.h"

#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <optional>

// The module in Debian's httpd as it is shipped, set up with the lines of its page, and server-wide settings that
// administrators have: each of them was a way around the lists, or made a client fail.

namespace rolvane {
namespace {

using test::DebianHttpd;
using testing::HasSubstr;
using testing::Not;

constexpr const char* kContacts = "/dav/alice/Contacts/";
// Answers with its own first line where it is run, and is readable text where it is not.
constexpr const char* kScript = "#!/bin/sh\necho 'Content-Type: text/plain'\necho\necho it has $((40+2)) run\n";

class OnDebian : public testing::Test {
protected:
    // Alice owns the tree, walter may write there, sam is a stranger.
    void begin() {
        for (const char* name : {"alice", "walter", "sam"}) httpd.addUser(name, rawPasswordOf(name));
        httpd.start();
        EXPECT_EQ(status("alice", "MKCOL", "/dav/alice/"), 201);
        EXPECT_EQ(status("alice", "MKCOL", kContacts), 201);
        EXPECT_EQ(status("alice", "PUT", "/dav/alice/Contacts/file", {}, "why"), 201);
        EXPECT_EQ(status("alice", "ACL", kContacts, {},
                         AccessWorld::acl(AccessWorld::ace(AccessWorld::user("walter"), "read write"))),
                  200);
    }
    RawAnswer ask(const std::string& user, const std::string& method, const std::string& path,
                  std::vector<std::pair<std::string, std::string>> headers = {}, const std::string& body = {}) const {
        for (auto& [name, value] : headers)
            if (name == "Destination") value.insert(0, "http://localhost:" + std::to_string(httpd.port()));
        return rawRequest(httpd.port(), {user, method, path, std::move(headers), body});
    }
    int status(const std::string& user, const std::string& method, const std::string& path,
               std::vector<std::pair<std::string, std::string>> headers = {}, const std::string& body = {}) const {
        return ask(user, method, path, std::move(headers), body).status;
    }
    std::string contacts(const std::string& name) const { return kContacts + name; }
    void expectIsAFile(const std::string& name, const std::string& text) const {
        for (const char* method : {"GET", "POST"}) {
            const RawAnswer answer = ask("alice", method, contacts(name));
            EXPECT_EQ(answer.status, 200) << method << " " << name << answer.body;
            EXPECT_EQ(answer.body, text) << method << " " << name;
        }
    }

    DebianHttpd httpd;
};

TEST_F(OnDebian, TheLinesOfThePageGiveAStoreThatTheListsGuard) {
    begin();
    EXPECT_EQ(ask("alice", "GET", contacts("file")).body, "why");
    EXPECT_EQ(status("walter", "PUT", contacts("file"), {}, "because"), 204);
    EXPECT_EQ(status("sam", "GET", contacts("file")), 403);
    EXPECT_EQ(status("", "GET", contacts("file")), 401);
    EXPECT_EQ(ask("alice", "PROPFIND", "/principals/users/alice", {{"Depth", "0"}}).status, 207);
    EXPECT_EQ(status("walter", "LOCK", contacts("file"), {}, AccessWorld::kLock), 200);
    EXPECT_EQ(httpd.log().find("davacl"), std::string::npos) << httpd.log();
}

TEST_F(OnDebian, APageForADirectoryTakesTheOwnersRequestsAway) {
    begin();
    for (const char* name : {"index.html", "index.cgi"})
        ASSERT_EQ(status("walter", "PUT", contacts(name), {}, "<p>mine</p>"), 201);
    EXPECT_EQ(status("alice", "ACL", kContacts, {}, AccessWorld::acl("")), 200);
    EXPECT_EQ(status("walter", "GET", contacts("file")), 403) << "the owner's list holds";
    EXPECT_EQ(ask("alice", "PROPFIND", kContacts, {{"Depth", "0"}}, AccessWorld::propfind("resourcetype"))
                  .body.find("index.html"),
              std::string::npos);
    const RawAnswer index = ask("alice", "GET", kContacts);
    EXPECT_EQ(index.status, 200);
    EXPECT_THAT(index.body, HasSubstr("The published tree of alice")) << "the module's own index, no page of walter's";
    EXPECT_THAT(index.body, Not(HasSubstr("<p>mine</p>")));
    EXPECT_EQ(status("alice", "DELETE", kContacts), 204);
    EXPECT_FALSE(std::filesystem::exists(httpd.trees() + "/alice/Contacts"));
}

TEST_F(OnDebian, ACollectionMayBeNamedWithoutItsSlash) {
    begin();
    const std::string collection = "/dav/alice/Contacts";
    for (const char* method : {"PROPFIND", "OPTIONS", "PROPPATCH"})
        EXPECT_NE(status("alice", method, collection, {{"Depth", "0"}},
                         std::string(method) == "PROPPATCH" ? AccessWorld::kPatch : ""),
                  301)
            << method;
    EXPECT_EQ(status("alice", "ACL", collection, {}, AccessWorld::acl("")), 200);
    EXPECT_EQ(status("alice", "MOVE", collection, {{"Destination", "/dav/alice/Moved"}}), 201);
    EXPECT_EQ(status("alice", "GET", "/dav/alice/Moved"), 200);
}

TEST_F(OnDebian, AnUploadedScriptIsAFileWhateverTheServerDoesWithScripts) {
    for (const char* module : {"cgid", "actions", "include", "asis", "rewrite"}) httpd.enable(module);
    std::ofstream(httpd.documents() + "/acted.cgi") << kScript;
    std::filesystem::permissions(httpd.documents() + "/acted.cgi", std::filesystem::perms(0755));
    httpd.addServerLines("AddHandler cgi-script .cgi\nAddHandler send-as-is .asis\nAddHandler server-parsed .parsed\n"
                         "Action own-type /acted.cgi\nAddHandler own-type .acted\n"
                         "<Directory />\nOptions +ExecCGI +Includes\n</Directory>\n"
                         "<FilesMatch \"\\.php$\">\nSetHandler cgi-script\n</FilesMatch>\n"
                         "<Location />\nOptions +ExecCGI +Includes\nXBitHack full\n</Location>\n"
                         "<If \"%{REQUEST_URI} =~ /forced/\">\nSetHandler cgi-script\n</If>\n");
    httpd.addSiteLines("RewriteEngine On\nRewriteRule \"\\.rewritten$\" - [H=cgi-script]\n");
    begin();
    for (const char* name : {"a.cgi", "a.php", "forced", "a.rewritten", "a.acted"}) {
        ASSERT_EQ(status("walter", "PUT", contacts(name), {}, kScript), 201);
        std::filesystem::permissions(httpd.trees() + "/alice/Contacts/" + name, std::filesystem::perms(0755));
        expectIsAFile(name, kScript);
        EXPECT_EQ(status("walter", "PUT", contacts(name), {}, kScript), 204) << "no script takes it: " << name;
        EXPECT_EQ(status("walter", "DELETE", contacts(name)), 204) << name;
    }
    const std::string included = "<!--#exec cmd=\"echo $((40+2))\" --><!--#include virtual=\"/dav/alice/own\" -->";
    for (const char* name : {"a.shtml", "a.parsed", "x.html"}) {
        ASSERT_EQ(status("walter", "PUT", contacts(name), {}, included), 201);
        std::filesystem::permissions(httpd.trees() + "/alice/Contacts/" + name, std::filesystem::perms(0755));
        expectIsAFile(name, included);
    }
    const std::string sent = "Status: 302 Found\nLocation: http://elsewhere.example/\n\nx";
    ASSERT_EQ(status("walter", "PUT", contacts("a.asis"), {}, sent), 201);
    expectIsAFile("a.asis", sent);
}

TEST_F(OnDebian, TheServersOwnHandlersAndFallbacksStayOutOfTheTrees) {
    for (const char* module : {"speling", "actions", "cgid"}) httpd.enable(module);
    std::ofstream(httpd.documents() + "/fallback.html") << "fallback";
    httpd.addServerLines("Script PUT /fallback.html\nScript DELETE /fallback.html\nScript GET /fallback.html\n"
                         "<Location />\nOptions +Indexes +MultiViews\nCheckSpelling On\n"
                         "FallbackResource /fallback.html\nErrorDocument 404 http://elsewhere.example/\n"
                         "ErrorDocument 403 /fallback.html\n</Location>\n"
                         "<Location /dav/alice>\nSetHandler server-status\n</Location>\n");
    begin();
    const std::string map = "URI: file\nContent-Type: text/plain\n";
    ASSERT_EQ(status("walter", "PUT", contacts("a.var"), {}, map), 201);
    expectIsAFile("a.var", map);
    EXPECT_EQ(status("walter", "PUT", contacts("page.html"), {}, "page"), 201);
    EXPECT_EQ(status("walter", "PUT", contacts("page"), {}, "another"), 201) << "MultiViews would have found page.html";
    EXPECT_EQ(ask("alice", "GET", contacts("page.html")).body, "page");
    EXPECT_EQ(ask("alice", "GET", contacts("page")).body, "another");
    EXPECT_EQ(status("alice", "GET", contacts("fiel")), 404) << "no guess, no fallback, no other place";
    EXPECT_THAT(ask("sam", "GET", contacts("file")).body, Not(HasSubstr("fallback")));
    const std::string base = ask("alice", "GET", "/dav/").body;
    EXPECT_THAT(base, HasSubstr("./alice/"));
    EXPECT_THAT(base, Not(HasSubstr("walter"))) << "nobody's list of all owners";
    EXPECT_THAT(base, Not(HasSubstr("fallback")));
    EXPECT_EQ(ask("alice", "GET", contacts("file") + "?auto").body, "why");
    EXPECT_EQ(status("alice", "DELETE", contacts("file")), 204);
}

TEST_F(OnDebian, NobodyUploadsConfiguration) {
    httpd.enable("cgid");
    httpd.addServerLines("AccessFileName .htaccess settings.conf\n");
    httpd.addSiteLines("<Directory \"" + httpd.trees() + "\">\nAllowOverride All\n</Directory>\n");
    begin();
    for (const char* name : {".htaccess", "settings.conf", ".htpasswd"}) {
        EXPECT_EQ(status("walter", "PUT", contacts(name), {}, "Options +ExecCGI\nSetHandler cgi-script\n"), 403)
            << name;
        EXPECT_EQ(status("alice", "PUT", std::string("/dav/alice/") + name, {}, "Dav Off\n"), 403) << name;
        EXPECT_EQ(status("alice", "MOVE", contacts("file"), {{"Destination", contacts(name)}}), 403) << name;
    }
    EXPECT_EQ(status("walter", "PUT", contacts("settings.conf.old"), {}, "x"), 201);
}

TEST_F(OnDebian, ATagThatWasShownIsTheOneThatIsTaken) {
    begin();
    const std::string text(5000, 'x');
    ASSERT_EQ(status("alice", "PUT", contacts("a.txt"), {}, text), 201);
    const RawAnswer answer = ask("alice", "GET", contacts("a.txt"), {{"Accept-Encoding", "gzip"}});
    const size_t at = answer.headers.find("ETag: ");
    ASSERT_NE(at, std::string::npos) << answer.headers;
    const std::string tag = answer.headers.substr(at + 6, answer.headers.find("\r\n", at) - at - 6);
    EXPECT_THAT(tag, Not(HasSubstr("gzip")));
    EXPECT_EQ(status("alice", "PUT", contacts("a.txt"), {{"If-Match", tag}}, "y"), 204);
}

TEST_F(OnDebian, AnUploadedPageRunsNothingInABrowser) {
    begin();
    ASSERT_EQ(status("walter", "PUT", contacts("x.html"), {}, "<script>alert(1)</script>"), 201);
    const RawAnswer answer = ask("alice", "GET", contacts("x.html"));
    EXPECT_THAT(answer.headers, HasSubstr("Content-Security-Policy: sandbox"));
    EXPECT_THAT(answer.headers, HasSubstr("X-Content-Type-Options: nosniff"));
}

// Whoever asks for a file that mod_cache keeps gets it before anybody looks at a list or a password.
TEST_F(OnDebian, TheServersCacheKeepsNothingOfATree) {
    for (const char* module : {"cache", "cache_disk", "headers", "expires"}) httpd.enable(module);
    std::filesystem::create_directory(httpd.path("cache"));
    httpd.give(httpd.path("cache"));
    httpd.addServerLines(
        "CacheRoot \"" + httpd.path("cache") +
        "\"\nCacheEnable disk /\nCacheIgnoreNoLastMod On\nCacheDefaultExpire 3600\n"
        "ExpiresActive On\nExpiresDefault \"access plus 1 month\"\n"
        "<FilesMatch \"\\.(jpg|css)$\">\nHeader set Cache-Control \"public, max-age=86400\"\n</FilesMatch>\n"
        "<FilesMatch \"\\.png$\">\nHeader always set Cache-Control \"public\"\n"
        "Header set Cache-Control \"s-maxage=3600\"\n</FilesMatch>\n"
        "<FilesMatch \"\\.txt$\">\nRequestHeader unset Authorization\n</FilesMatch>\n");
    begin();
    std::ofstream(httpd.documents() + "/site.css") << "site";
    for (int i = 0; i < 2; ++i) EXPECT_EQ(ask("", "GET", "/site.css").body, "site");
    EXPECT_FALSE(std::filesystem::is_empty(httpd.path("cache"))) << "the cache works";
    for (const char* name : {"photo.jpg", "photo.png", "plain.txt"}) {
        ASSERT_EQ(status("alice", "PUT", contacts(name), {}, "alice's"), 201);
        for (int i = 0; i < 2; ++i) {
            const RawAnswer answer = ask("alice", "GET", contacts(name));
            EXPECT_EQ(answer.body, "alice's");
            EXPECT_THAT(answer.headers, HasSubstr("Cache-Control: private, no-cache")) << name;
            for (const char* word : {"public", "max-age", "maxage", "Expires"})
                EXPECT_THAT(answer.headers, Not(HasSubstr(word))) << name;
        }
        EXPECT_EQ(status("", "GET", contacts(name)), 401) << name;
        EXPECT_EQ(status("sam", "GET", contacts(name)), 403) << name;
    }
}

// Alias and a second virtual host lead to the same files without the base in their URL.
TEST_F(OnDebian, TheFilesOfTheTreesAreServedAtTheBaseAndNowhereElse) {
    const std::string port = std::to_string(httpd.port());
    httpd.addSiteLines("Alias /second \"" + httpd.trees() +
                       "\"\n<Location /second>\nDav On\nRequire all granted\n"
                       "</Location>\nAlias /lists \"" +
                       httpd.lists() +
                       "\"\n<Location /lists>\nDav On\n"
                       "Require all granted\n</Location>\n");
    httpd.addServerLines("<VirtualHost *:" + port + ">\nServerName other.example\nDocumentRoot \"" + httpd.path("") +
                         "\"\n<Location />\nDav On\nRequire all granted\n</Location>\n</VirtualHost>\n");
    begin();
    EXPECT_EQ(status("", "GET", "/second/alice/Contacts/file"), 403);
    EXPECT_EQ(status("sam", "PUT", "/second/alice/Contacts/file", {}, "x"), 403);
    EXPECT_EQ(status("sam", "PROPFIND", "/second/alice/Contacts/", {{"Depth", "1"}}), 403);
    EXPECT_EQ(status("", "GET", "/lists/alice.acl"), 403);
    const std::vector<std::pair<std::string, std::string>> other = {{"Host", "other.example"}};
    EXPECT_EQ(status("", "GET", "/dav/alice/Contacts/file", other), 403);
    EXPECT_EQ(status("", "PUT", "/dav/alice/Contacts/new", other, "x"), 403);
    EXPECT_EQ(status("", "DELETE", "/dav/", other), 403);
    EXPECT_EQ(status("", "GET", "/davacl/alice.acl", other), 403);
    EXPECT_EQ(status("", "PUT", "/davacl/alice.acl", other, "davacl 1\nend\n"), 403);
    EXPECT_EQ(status("", "GET", "/dav-users", other), 200) << "that host is open: what is not a tree is its own matter";
    EXPECT_THAT(httpd.log(), HasSubstr("also reached as"));
}

// A part of the base's URLs may be the site's own: that opens no tree, and does not shut the site.
TEST_F(OnDebian, APlaceOfTheSiteBelowTheBaseShutsNothingElse) {
    std::filesystem::create_directory(httpd.documents() + "/help");
    std::ofstream(httpd.documents() + "/help/page.txt") << "help";
    std::ofstream(httpd.documents() + "/index.html") << "site";
    httpd.addSiteLines("<Location /dav/help>\nAlias \"" + httpd.documents() + "/help\"\n</Location>\n");
    begin();
    EXPECT_EQ(ask("", "GET", "/index.html").body, "site");
    for (const char* path : {"/dav/help/page.txt", "/dav/help/", "/dav/help/none"}) ask("", "GET", path);
    EXPECT_EQ(ask("", "GET", "/index.html").body, "site") << "a request of a stranger's shuts nothing";
    EXPECT_EQ(ask("", "GET", "/help/page.txt").body, "help");
}

// mod_cern_meta takes headers of an answer from a file beside the one that is sent.
TEST_F(OnDebian, NobodyUploadsHeaders) {
    httpd.enable("cern_meta");
    httpd.addServerLines("<Location />\nMetaFiles On\n</Location>\n");
    begin();
    std::filesystem::create_directory(httpd.documents() + "/.web");
    std::ofstream(httpd.documents() + "/.web/site.txt.meta") << "X-Site: yes\n";
    std::ofstream(httpd.documents() + "/site.txt") << "site";
    EXPECT_THAT(ask("", "GET", "/site.txt").headers, HasSubstr("X-Site: yes")) << "that is how it works";
    ASSERT_EQ(status("walter", "MKCOL", contacts(".web")), 201);
    ASSERT_EQ(status("walter", "PUT", contacts(".web/file.meta"), {}, "Set-Cookie: session=walters\nX-Walters: yes\n"),
              201);
    const RawAnswer answer = ask("alice", "GET", contacts("file"));
    EXPECT_EQ(answer.body, "why");
    EXPECT_THAT(answer.headers, Not(HasSubstr("alters")));
}

TEST_F(OnDebian, AWayAroundTheListsThatCannotBeClosedKeepsItFromStarting) {
    std::filesystem::create_directory_symlink(httpd.trees(), httpd.path("linked"));
    httpd.addSiteLines("Alias /linked \"" + httpd.path("linked") + "\"\n");
    EXPECT_THAT(httpd.complaint(), testing::AllOf(HasSubstr("symbolic link"), HasSubstr("DavAclStrict")));
}

TEST_F(OnDebian, AWayAroundTheListsIsAWarningForThoseWhoWantItSo) {
    std::filesystem::create_directory_symlink(httpd.trees(), httpd.path("linked"));
    httpd.addSiteLines("DavAclStrict Off\nAlias /linked \"" + httpd.path("linked") + "\"\n");
    begin();
    EXPECT_THAT(httpd.log(), HasSubstr("symbolic link"));
}

TEST_F(OnDebian, OneTreeUnderTwoListsKeepsItFromStarting) {
    std::filesystem::create_directory(httpd.path("otherlists"));
    std::filesystem::permissions(httpd.path("otherlists"), std::filesystem::perms::owner_all);
    httpd.give(httpd.path("otherlists"));
    httpd.addServerLines("<VirtualHost *:" + std::to_string(httpd.port()) +
                         ">\nServerName other.example\nDavAclBase /other \"" + httpd.path("otherlists") +
                         "\"\nAlias /other \"" + httpd.trees() + "\"\n</VirtualHost>\n");
    EXPECT_THAT(httpd.complaint(), HasSubstr("the same trees"));
}

TEST_F(OnDebian, ListsThatHttpdCannotKeepAreSaidAtTheStart) {
    if (geteuid() != 0) {
        std::filesystem::permissions(httpd.lists(), std::filesystem::perms::owner_read);
    } else {
        ASSERT_EQ(chown(httpd.lists().c_str(), 0, 0), 0);
    }
    EXPECT_THAT(httpd.complaint(), HasSubstr("directory of the access lists"));
}

} // namespace
} // namespace rolvane
