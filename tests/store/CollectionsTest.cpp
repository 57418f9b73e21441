#include "store/dav/Collections.h"
#include "StoreWorld.h"
#include "store/locks/StoreLock.h"

#include <gtest/gtest.h>

namespace rolvane {
namespace {

using namespace test;

// A store as distributions ship it: mod_dir answers the name of a collection without its slash with a redirect,
// whatever the method.
PrivateStoreOptions withModDir() {
    PrivateStoreOptions options;
    options.extraConfiguration = {"LoadModule dir_module \"" + options.httpdModules + "/mod_dir.so\""};
    return options;
}

size_t redirects(const Client& client) {
    size_t n = 0;
    for (const auto& e : client.wire->exchanges()) n += e.status >= 300 && e.status < 400;
    return n;
}

// Everything that a publisher and a reader do, in a process that knows nothing yet and in one that does.
TEST(Collections, AStoreWithModDirServesAWholePublication) {
    StoreWorld world(withModDir());
    Client alice(world);
    CXDAVError error;
    ASSERT_TRUE(alice.manager.canReach(error)) << error.reason;
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true)) << alice.wire->text();
    EXPECT_TRUE(alice.manager.canReach(error)) << error.reason;
    EXPECT_TRUE(alice.manager.sanityCheckPublishStructureCreate(false));
    EXPECT_TRUE(alice.manager.setACLsWithReadPrincipals({"bob"}, {}, alice.base)) << alice.wire->text();
    auto lock = makeStoreLock(alice.manager, alice.at("dateFile"));
    EXPECT_TRUE(lock->tryLock());
    EXPECT_TRUE(alice.manager.createDirectoryAtAURL(alice.at("A:CXGroup")));
    EXPECT_EQ(alice.write("A:CXGroup", Dictionary{{"a", 1}}), 201);
    EXPECT_EQ(alice.write("A:CXGroup/info", Dictionary{{"a", 2}}), 201);
    EXPECT_EQ(alice.write("People/4/B:CXPerson", Dictionary{{"a", 3}}), 201);
    lock->unlock();
    EXPECT_EQ(redirects(alice), 0u) << alice.wire->text();

    Client bob(world, "bob");
    ASSERT_TRUE(bob.manager.canReach(error)) << error.reason;
    EXPECT_EQ(bob.read("A:CXGroup").second, (Dictionary{{"a", 1}})) << bob.wire->text();
    EXPECT_EQ(bob.read("A:CXGroup/info").second, (Dictionary{{"a", 2}}));
    const auto listing = bob.manager.infoForFilesInContainer(bob.base);
    ASSERT_TRUE(listing) << bob.wire->text();
    EXPECT_TRUE(listing->contains("/alice/Contacts/People/4/B:CXPerson"));

    Client later(world);
    std::vector<std::string> readers, writers;
    EXPECT_TRUE(later.manager.ACLsAtURL(later.base, readers, writers));
    EXPECT_EQ(readers, std::vector<std::string>{"bob"});
    int code = 0;
    EXPECT_TRUE(later.manager.removeFileAtURL(later.at("A:CXGroup"), &code)) << later.wire->text();
    EXPECT_EQ(later.read("A:CXGroup").first, 404);
    EXPECT_TRUE(later.manager.removeDirectoryAndContentsAtURL(later.base)) << later.wire->text();
    EXPECT_FALSE(std::filesystem::exists(world.file()));
}

TEST(Collections, AFileGivesWayToACollectionThere) {
    StoreWorld world(withModDir());
    Client alice(world);
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    ASSERT_EQ(alice.write("A:CXGroup", Dictionary{{"a", 1}}), 201);
    ASSERT_TRUE(alice.manager.createDirectoryAtAURL(alice.at("A:CXGroup"))) << alice.wire->text();
    EXPECT_TRUE(std::filesystem::is_directory(world.file("A:CXGroup")));
    Client fresh(world);
    EXPECT_EQ(fresh.read("A:CXGroup").second, (Dictionary{{"a", 1}})) << fresh.wire->text();
    EXPECT_EQ(fresh.write("A:CXGroup", Dictionary{{"a", 2}}), 204) << fresh.wire->text();
    EXPECT_TRUE(fresh.manager.createDirectoryAtAURL(fresh.at("A:CXGroup"))) << "it is there";
}

// As nginx does: without its slash a collection can be neither made nor removed, and with one a file is not there.
TEST(Collections, AServerThatTellsThemByTheirSlashIsServed) {
    StoreWorld world;
    Client alice(world);
    alice.wire->intercept([&](const HttpRequest& r) -> std::optional<HttpResponse> {
        const bool slash = r.url.encodedPath().ends_with('/');
        if (r.method == "MKCOL" && !slash) return answerOf(409);
        const std::string name = r.url.encodedPath().substr(std::string("/dav/alice/Contacts").size());
        if (r.method == "DELETE" && !slash &&
            std::filesystem::is_directory(world.file(Url::percentDecode(name.substr(1)))))
            return answerOf(409);
        return std::nullopt;
    });
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true)) << alice.wire->text();
    ASSERT_TRUE(alice.manager.createDirectoryAtAURL(alice.at("A:CXGroup")));
    EXPECT_EQ(alice.write("A:CXGroup", Dictionary{{"a", 1}}), 201);
    EXPECT_TRUE(alice.manager.removeFileAtURL(alice.at("A:CXGroup"), nullptr));
    EXPECT_FALSE(std::filesystem::exists(world.file("A:CXGroup")));

    std::filesystem::create_directory(world.file("B:CXGroup")); // of which this process knows nothing
    EXPECT_TRUE(alice.manager.removeFileAtURL(alice.at("B:CXGroup"), nullptr)) << alice.wire->text();
    EXPECT_FALSE(std::filesystem::exists(world.file("B:CXGroup")));
    EXPECT_TRUE(alice.manager.failures().take().empty());
}

TEST(Collections, AFileInThePlaceOfAKnownCollectionIsRemoved) {
    StoreWorld world;
    Client alice(world);
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    ASSERT_TRUE(alice.manager.createDirectoryAtAURL(alice.at("A:CXGroup")));
    std::filesystem::remove_all(world.file("A:CXGroup"));
    std::ofstream(world.file("A:CXGroup")) << "x";
    EXPECT_TRUE(alice.manager.removeFileAtURL(alice.at("A:CXGroup"), nullptr)) << alice.wire->text();
    EXPECT_FALSE(std::filesystem::exists(world.file("A:CXGroup")));
}

HttpResponse sendingTo(const std::string& location, int status = 301) {
    return answerOf(status, {{"location", location}});
}

TEST(Collections, OnlyARedirectThatAddsTheSlashOnTheSameOriginIsFollowed) {
    const Url asked("https://dav.example.org/dav/al%20ice/Contacts");
    const Url expected("https://dav.example.org/dav/al%20ice/Contacts/");
    for (const char* location :
         {"https://dav.example.org/dav/al%20ice/Contacts/", "https://dav.example.org:443/dav/al%20ice/Contacts/",
          "/dav/al%20ice/Contacts/", "HTTPS://DAV.example.org/dav/%61l%20ice/Contacts/",
          "//dav.example.org/dav/al%20ice/Contacts/"})
        for (const int status : {301, 302, 307, 308})
            EXPECT_EQ(redirectToCollection(asked, sendingTo(location, status)), expected) << location;
    for (const char* location :
         {"http://dav.example.org/dav/al%20ice/Contacts/", "https://evil.example.org/dav/al%20ice/Contacts/",
          "https://dav.example.org:8443/dav/al%20ice/Contacts/", "/dav/bob/Contacts/", "/dav/al%20ice/Contacts",
          "/dav/al%20ice/Contacts/?x=1", "/dav/al%20ice/Contacts/#x", "/dav/al%20ice/Contacts/index.html/",
          "/dav/al%20ice/../al%20ice/Contacts/", "/login/", "Contacts/", "", "not a url"})
        EXPECT_EQ(redirectToCollection(asked, sendingTo(location)), std::nullopt) << location;
    for (const int status : {200, 300, 303, 304, 404})
        EXPECT_EQ(redirectToCollection(asked, sendingTo("/dav/al%20ice/Contacts/", status)), std::nullopt) << status;
    EXPECT_EQ(redirectToCollection(expected, sendingTo("/dav/al%20ice/Contacts/")), std::nullopt) << "a circle";
}

TEST(Collections, AConditionOnTheSamePlaceGoesAlong) {
    HttpRequest request;
    request.method = "DELETE";
    request.url = Url("https://dav.example.org/a");
    request.headers = {{"If", "<https://dav.example.org/a> (<urn:x>)"}, {"Depth", "0"}};
    const HttpRequest sent = sentTo(request, Url("https://dav.example.org/a/"));
    EXPECT_EQ(sent.url.absoluteString(), "https://dav.example.org/a/");
    EXPECT_EQ(sent.headers.front().second, "<https://dav.example.org/a/> (<urn:x>)");
}

// Every method: a redirect to the slash is followed once, any other is an error that names where it leads.
TEST(Collections, AnyOtherRedirectIsAnErrorThatNamesItsTarget) {
    StoreWorld world;
    Client alice(world);
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    const std::string elsewhere = "https://elsewhere.example.org/sign-in";
    std::string asked;
    alice.wire->intercept([&](const HttpRequest& r) -> std::optional<HttpResponse> {
        if (r.method == "OPTIONS" && asked != "OPTIONS") return std::nullopt;
        return sendingTo(elsewhere, 302);
    });
    const auto failsWithTheTarget = [&](const char* method, bool succeeded) {
        EXPECT_FALSE(succeeded) << method;
        const auto failures = alice.manager.failures().take();
        ASSERT_FALSE(failures.empty()) << method;
        EXPECT_EQ(failures.back().method, method);
        EXPECT_NE(failures.back().words.find(elsewhere), std::string::npos) << method << ": " << failures.back().words;
    };
    alice.manager.failures().take();
    failsWithTheTarget("PUT", alice.manager.write("x", alice.at("x"), true));
    failsWithTheTarget("GET", alice.manager.dictionaryAtURL(alice.at("x"), true, nullptr).has_value());
    failsWithTheTarget("DELETE", alice.manager.removeFileAtURL(alice.at("x"), nullptr));
    failsWithTheTarget("PROPFIND", alice.manager.infoForFilesInContainer(alice.base).has_value());
    failsWithTheTarget("LOCK", makeStoreLock(alice.manager, alice.at("dateFile"))->tryLock());
    asked = "OPTIONS";
    CXDAVError error;
    failsWithTheTarget("OPTIONS", alice.manager.canReach(error));
    EXPECT_EQ(error.code, kCXDAVErrorBadServerResponse);
    EXPECT_NE(error.reason.find(elsewhere), std::string::npos) << error.reason;
    for (const auto& e : alice.wire->exchanges()) EXPECT_EQ(e.path.find("sign-in"), std::string::npos);
}

} // namespace
} // namespace rolvane
