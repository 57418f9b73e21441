#include "StoreWorld.h"
#include "foundation/PropertyList.h"
#include "store/dav/CXDAVNode.h"
#include "store/locks/StoreLock.h"
#include "support/CapturingLog.h"

#include <atomic>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace rolvane {
namespace {

using namespace test;

// A client whose every request is answered by a script.
struct Scripted {
    explicit Scripted(RecordingTransport::Interceptor script) : wire(std::make_shared<RecordingTransport>()) {
        CXDAVAccount a;
        a.user = UserName("alice");
        a.endpoint = "https://dav.example.org/dav/{user}/Contacts";
        wire->intercept(std::move(script));
        manager = std::make_unique<CXDAVManager>(a, wire);
        base = a.baseLocationFor(a.user);
    }
    TempHome home;
    std::shared_ptr<RecordingTransport> wire;
    std::unique_ptr<CXDAVManager> manager;
    Url base;
};

const HttpResponse kDavOptions = answerOf(200, {{"dav", "1, 2"}});

std::string multistatus(const std::string& responses) {
    return "<?xml version=\"1.0\"?><D:multistatus xmlns:D=\"DAV:\">" + responses + "</D:multistatus>";
}
std::string response(const std::string& href, bool collection, const std::string& more = {}) {
    return "<D:response><D:href>" + href + "</D:href><D:propstat><D:prop><D:resourcetype>" +
           (collection ? "<D:collection/>" : "") +
           "</D:resourcetype><D:getlastmodified>Fri, 20 Nov 2026 23:48:00 GMT</D:getlastmodified>" + more +
           "</D:prop><D:status>HTTP/1.1 200 OK</D:status></D:propstat></D:response>";
}

TEST(HostileStore, ACaptivePortalIsUnreachableAndNeverForbidden) {
    CXDAVError error;
    for (const int status : {200, 302, 403, 404}) {
        Scripted s([=](const HttpRequest&) {
            return answerOf(status, {{"content-type", "text/html"}}, "<html>Pay</html>");
        });
        EXPECT_FALSE(s.manager->canReach(error));
        EXPECT_EQ(error.code, kCXDAVErrorBadServerResponse) << status;
        int code = -1;
        EXPECT_FALSE(s.manager->dictionaryAtURL(s.base.cxURLByAppendingComponent("info"), false, &code));
        EXPECT_NE(code, 403);
        EXPECT_NE(code, 404);
        EXPECT_FALSE(s.manager->infoForFilesInContainer(s.base));
        EXPECT_FALSE(s.manager->sanityCheckPublishStructureCreate(true));
        EXPECT_EQ(s.wire->count("MKCOL") + s.wire->count("PUT"), 0u) << status;
    }
}

TEST(HostileStore, ForbiddenAndAbsentAreBelievedFromAWebDAVServer) {
    for (const int status : {403, 404}) {
        Scripted s([=](const HttpRequest& r) { return r.method == "OPTIONS" ? kDavOptions : answerOf(status); });
        int code = -1;
        EXPECT_FALSE(s.manager->dictionaryAtURL(s.base.cxURLByAppendingComponent("info"), false, &code));
        EXPECT_EQ(code, status);
    }
}

std::string nestedDictionaries(int depth) {
    std::string opening, closing;
    for (int i = 1; i < depth; ++i) {
        opening += "<dict><key>k</key>";
        closing += "</dict>";
    }
    return "<plist version=\"1.0\">" + opening + "<dict/>" + closing + "</plist>";
}

// What a store says becomes part of the prior state, some containers further in, and that must still be written.
TEST(HostileStore, ADictionaryThatIsNestedTooDeepToBeKeptIsNone) {
    for (const int depth : {48, 49, 64}) {
        Scripted s([=](const HttpRequest& r) {
            return r.method == "OPTIONS" ? kDavOptions : answerOf(200, {}, nestedDictionaries(depth));
        });
        int code = -1;
        const auto read = s.manager->dictionaryAtURL(s.base.cxURLByAppendingComponent("info"), false, &code);
        EXPECT_EQ(read.has_value(), depth == 48) << depth;
        if (!read) continue;
        Value kept = *read;
        for (int i = 0; i < 8; ++i) kept = Dictionary{{"level", kept}};
        EXPECT_NO_THROW(PropertyList::toXML(kept));
        EXPECT_NO_THROW(BinaryValue::encode(kept));
    }
}

TEST(HostileStore, WritesNothingToTheStandardErrorOfItsReader) {
    const std::string bodies[] = {
        "<?xml version=\"1.0\" encoding=\"no-such-thing\"?><D:x xmlns:D=\"DAV:\"/>",
        "<?xml version=\"1.0\" encoding=\"utf-8\"?><D:x xmlns:D=\"DAV:\">\xff\xfe\xc3(</D:x>",
        "<?xml version=\"1.0\" encoding=\"utf-16\"?><D:x xmlns:D=\"DAV:\">a</D:x>",
        "<?xml version=\"1.0\" encoding=\"iso-2022-jp\"?><D:x xmlns:D=\"DAV:\">\x1b$B\xff</D:x>",
        "<?xml version=\"1.0\" encoding=\"us-ascii\"?><D:x xmlns:D=\"DAV:\">\xe4</D:x>",
        std::string("\xff\xfe<\0?\0x\0m\0l\0\xd8\xd8", 14),
        "<!DOCTYPE x SYSTEM \"http://127.0.0.1:1/x\"><x>&y;</x>",
        "<p:x/>",
        "<x xmlns:a=\"not a uri %\" xmlns:a=\"b\" c=\"<\"/>"};
    testing::internal::CaptureStderr();
    for (const std::string& body : bodies) {
        (void)parseDAVTree(body);
        EXPECT_THROW(PropertyList::fromXML(body), CXException);
    }
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
}

TEST(HostileStore, OnlyEncodingsThatXMLReadersShareAreRead) {
    const auto isRead = [](const std::string& encoding, const char* text) {
        return parseDAVTree("<?xml version=\"1.0\" encoding=\"" + encoding + "\"?><D:x xmlns:D=\"DAV:\">" + text +
                            "</D:x>")
            .has_value();
    };
    for (const char* each : {"utf-8", "UTF-8", "iso-8859-1", "us-ascii"}) EXPECT_TRUE(isRead(each, "a")) << each;
    EXPECT_TRUE(isRead("ISO-8859-1", "\xe4"));
    for (const char* each : {"utf08", "koi8-r", "windows-1251", "shift_jis", "utf-7"})
        EXPECT_FALSE(isRead(each, "a")) << each;
}

TEST(HostileStore, AServerOfAnotherClassIsNotAWebDAVServer) {
    CXDAVError error;
    const auto isOne = [&](const char* dav) {
        Scripted s([=](const HttpRequest& r) {
            return r.method == "OPTIONS" ? answerOf(200, {{"dav", dav}}) : answerOf(404);
        });
        return s.manager->canReach(error);
    };
    for (const char* dav : {"", "4", "11", "x1", "<http://example.org/1>"}) EXPECT_FALSE(isOne(dav)) << dav;
    for (const char* dav : {"1", "2", "1, 2", "3,2"}) EXPECT_TRUE(isOne(dav)) << dav;
}

TEST(HostileStore, AMultistatusToAWriteIsAFailure) {
    Scripted s(
        [](const HttpRequest& r) { return r.method == "OPTIONS" ? kDavOptions : answerOf(207, {}, multistatus("")); });
    int code = 0;
    const Url file = s.base.cxURLByAppendingComponent("x");
    EXPECT_FALSE(s.manager->write("why", file, false, &code));
    EXPECT_EQ(code, 207);
    EXPECT_FALSE(s.manager->removeFileAtURL(file, &code));
    EXPECT_FALSE(s.manager->createDirectoryAtAURL(file));
}

TEST(HostileStore, ADeniedWriteCarriesTheServersCode) {
    for (const int status : {401, 403, 423, 500, 507}) {
        Scripted s([=](const HttpRequest& r) { return r.method == "OPTIONS" ? kDavOptions : answerOf(status); });
        int code = 0;
        EXPECT_FALSE(s.manager->write("why", s.base.cxURLByAppendingComponent("dateFile"), false, &code));
        EXPECT_EQ(code, status);
    }
}

TEST(HostileStore, AListingWithAnyFlawIsNoListing) {
    const std::string whole =
        multistatus(response("/dav/alice/Contacts/", true) +
                    response("/dav/alice/Contacts/A%3ACXGroup", false, "<D:getetag>\"1\"</D:getetag>"));
    const auto listed = [](int status, const std::string& body) {
        Scripted s(
            [=](const HttpRequest& r) { return r.method == "OPTIONS" ? kDavOptions : answerOf(status, {}, body); });
        return s.manager->infoForFilesInContainer(s.base);
    };
    ASSERT_TRUE(listed(207, whole));
    EXPECT_EQ(listed(207, whole)->size(), 1u);
    for (size_t n = 0; n < whole.size(); n += 7) EXPECT_FALSE(listed(207, whole.substr(0, n))) << n;
    EXPECT_TRUE(listed(200, whole)) << "a body of that kind says what it is";
    EXPECT_FALSE(listed(200, "<html>multistatus</html>"));
    EXPECT_FALSE(listed(203, whole));
    EXPECT_FALSE(listed(500, whole));
    EXPECT_FALSE(listed(207, multistatus("")));
    const std::string content = whole.substr(21);
    EXPECT_TRUE(listed(207, "<?xml version=\"1.0\"?><!DOCTYPE x>" + content));
    for (const char* declared :
         {"<!ENTITY e \"v\">", "<!ENTITY % e \"v\">", "<!ENTITY e SYSTEM \"file:/etc/passwd\">", "<!ELEMENT x ANY>",
          "<!ATTLIST D:href xmlns CDATA \"x\">", "<!NOTATION n SYSTEM \"x\">"})
        EXPECT_FALSE(listed(207, "<?xml version=\"1.0\"?><!DOCTYPE x [" + std::string(declared) + "]>" + content))
            << declared;
    std::string reference = content;
    reference.replace(reference.find("A%3A"), 4, "&e;");
    EXPECT_FALSE(listed(207, "<?xml version=\"1.0\"?><!DOCTYPE x SYSTEM \"x.dtd\">" + reference));
    std::string deep;
    for (int i = 0; i < 100; ++i) deep += "<a>";
    for (int i = 0; i < 100; ++i) deep += "</a>";
    EXPECT_FALSE(listed(207, multistatus(response("/dav/alice/Contacts/", true) + deep)));
}

TEST(HostileStore, AFailedBucketFailsTheWholeListing) {
    Scripted s([](const HttpRequest& r) -> std::optional<HttpResponse> {
        const std::string path = r.url.encodedPath();
        if (r.method == "OPTIONS") return kDavOptions;
        if (path.ends_with("Contacts/"))
            return answerOf(
                207, {},
                multistatus(response("/dav/alice/Contacts/", true) + response("/dav/alice/Contacts/People/", true)));
        if (path.ends_with("People/"))
            return answerOf(207, {},
                            multistatus(response("/dav/alice/Contacts/People/", true) +
                                        response("/dav/alice/Contacts/People/0/", true) +
                                        response("/dav/alice/Contacts/People/1/", true)));
        if (path.ends_with("0/"))
            return answerOf(207, {}, multistatus(response("/dav/alice/Contacts/People/0/", true)));
        return answerOf(500);
    });
    EXPECT_FALSE(s.manager->infoForFilesInContainer(s.base));
}

TEST(HostileStore, EntriesOutsideTheTreeOrWithHostileNamesAreLeftOut) {
    CapturingLog log;
    const std::string own = "/dav/alice/Contacts/";
    Scripted s([=](const HttpRequest& r) -> std::optional<HttpResponse> {
        if (r.method == "OPTIONS") return kDavOptions;
        std::string body = response(own, true);
        for (const std::string& href :
             {own + "../bob/A%3ACXGroup", own + "%2e%2e", own + "..%2fB%3ACXGroup", own + "a%00b%3ACXGroup",
              own + "x%0aCXGroup", own + "sub/C%3ACXGroup", std::string("/etc/passwd"),
              std::string("https://evil.example.org") + own + "D%3ACXGroup",
              std::string("//evil.example.org") + own + "E%3ACXGroup", std::string("/dav/bob/Contacts/F%3ACXGroup"),
              own + "G%3ACXGroup?x=1", std::string()})
            body += response(href, false);
        body += response("https://dav.example.org" + own + "Good%3ACXGroup", false);
        return answerOf(207, {}, multistatus(body));
    });
    const auto listing = s.manager->infoForFilesInContainer(s.base);
    ASSERT_TRUE(listing);
    // Nothing is sent to the host of an href: of a whole URL the path counts, as behind a proxy.
    ASSERT_EQ(listing->size(), 2u);
    EXPECT_EQ(listing->begin()->first, "/alice/Contacts/D:CXGroup");
    EXPECT_EQ(listing->rbegin()->second.displayName, "Good:CXGroup");
    EXPECT_EQ(listing->rbegin()->first, "/alice/Contacts/Good:CXGroup");
    EXPECT_TRUE(log.mentions("left out"));
}

TEST(HostileStore, WhatIsNoPropertyListIsNoDictionary) {
    for (const char* body :
         {"", "garbage", "<plist><array/></plist>", "\xff\xfe", "<?xml version=\"1.0\"?><plist><dict>"}) {
        Scripted s([=](const HttpRequest&) { return answerOf(200, {}, body); });
        int code = 0;
        EXPECT_FALSE(s.manager->dictionaryAtURL(s.base.cxURLByAppendingComponent("info"), false, &code)) << body;
        EXPECT_EQ(code, 200);
    }
}

// An answer whose end nobody announced, from a connection that was cut off.
TEST(HostileStore, AStateThatWasCutOffIsNotReplaced) {
    const std::string whole = PropertyList::toXML(Dictionary{{"memberUIDState", Array{"A:CXPerson", "B:CXPerson"}}});
    std::vector<std::string> bodies;
    Scripted s([&](const HttpRequest& r) {
        if (r.method == "OPTIONS") return kDavOptions;
        if (r.method == "PUT") return answerOf(204);
        const std::string body = bodies.front();
        if (bodies.size() > 1) bodies.erase(bodies.begin());
        return answerOf(200, {{"etag", "\"1\""}}, body);
    });
    const Url group = s.base.cxURLByAppendingComponent("A:CXGroup");

    bodies = {whole.substr(0, 150), whole};
    EXPECT_TRUE(s.manager->dictionaryAtURL(group, false, nullptr)) << "asked again";

    bodies = {whole.substr(0, 150), whole.substr(0, 170)};
    EXPECT_FALSE(s.manager->dictionaryAtURL(group, false, nullptr));
    int code = -1;
    EXPECT_FALSE(s.manager->write("x", group, false, &code));
    EXPECT_EQ(code, 0);
    EXPECT_EQ(s.wire->count("PUT"), 0u);

    bodies = {"garbage"};
    EXPECT_FALSE(s.manager->dictionaryAtURL(group, false, nullptr));
    EXPECT_TRUE(s.manager->write("x", group, false)) << "what the store really holds can be replaced";
}

TEST(HostileStore, AVersionThatIsNoDictionaryIsUnseenUntilTheStoreHasToldItTwiceAlike) {
    std::atomic<int> reads = 0;
    std::atomic<bool> cutOff = true;
    Scripted s([&](const HttpRequest& r) {
        if (r.method == "OPTIONS") return kDavOptions;
        if (r.method == "GET") // cut off at another place each time, as a broken connection does
            return answerOf(200, {{"etag", "\"1\""}},
                            "<?xml version=\"1.0\"?><plist><dict>" + std::string(cutOff ? size_t(++reads) : 0, ' '));
        return answerOf(207, {{"date", "Sat, 21 Nov 2026 10:00:00 GMT"}},
                        multistatus(response("/dav/alice/Contacts/", true) +
                                    response("/dav/alice/Contacts/x", false, "<D:getetag>\"1\"</D:getetag>")));
    });
    const auto isSeen = [&] {
        s.manager->dictionaryAtURL(s.base.cxURLByAppendingComponent("x"), false, nullptr);
        const auto listing = s.manager->infoForFilesInContainer(s.base);
        return listing && listing->begin()->second.seen;
    };
    EXPECT_FALSE(isSeen());
    EXPECT_FALSE(isSeen());
    cutOff = false;
    EXPECT_TRUE(isSeen());
}

TEST(HostileStore, NamesOfAnotherStoreAreNeverAskedFor) {
    Scripted s([](const HttpRequest&) { return answerOf(200); });
    int code = -1;
    for (const char* name :
         {"http://other.example.org/alice/Contacts/info", "http://dav.example.org/alice/Contacts/../x",
          "http://dav.example.org/alice/Contacts/%2e%2e/x", "http://dav.example.org/alice", "file:/etc/passwd"}) {
        EXPECT_FALSE(s.manager->dictionaryAtURL(Url(name), false, &code)) << name;
        EXPECT_EQ(code, 0);
        EXPECT_FALSE(s.manager->write("x", Url(name), false));
    }
    EXPECT_EQ(s.wire->methods(), "");
}

TEST(HostileStore, EveryRequestGoesOverTls) {
    Scripted s([](const HttpRequest& r) {
        EXPECT_EQ(r.url.scheme(), "https");
        return r.method == "OPTIONS" ? kDavOptions : answerOf(201);
    });
    EXPECT_TRUE(s.manager->write("why", s.base.cxURLByAppendingComponent("dateFile"), false));
    EXPECT_TRUE(s.manager->write("why", s.base.cxURLByAppendingComponent("dateFile"), true));
}

TEST(HostileStore, AWeakTagIsComparedByTheWebDAVHeader) {
    Scripted s([](const HttpRequest& r) {
        if (r.method == "GET") return answerOf(200, {{"etag", "W/\"5\""}}, PropertyList::toXML(Dictionary{{"a", 1}}));
        return r.method == "OPTIONS" ? kDavOptions : answerOf(204);
    });
    const Url file = s.base.cxURLByAppendingComponent("info");
    s.manager->dictionaryAtURL(file, false, nullptr);
    EXPECT_TRUE(s.manager->write("x", file, false));
    const auto put = s.wire->exchanges().back();
    EXPECT_EQ(put.header("If"), "<https://dav.example.org/dav/alice/Contacts/info> ([W/\"5\"])");
    EXPECT_EQ(put.header("If-Match"), "");
}

TEST(HostileStore, ALockAnswerWithoutATokenIsNoLock) {
    for (const char* token : {"", "<>", "no brackets", "<a\r\nb>"}) {
        Scripted s([=](const HttpRequest& r) {
            return r.method == "OPTIONS" ? kDavOptions
                                         : answerOf(200, {{"lock-token", token}}, "<prop xmlns=\"DAV:\"/>");
        });
        auto lock = makeStoreLock(*s.manager, s.base.cxURLByAppendingComponent("dateFile"));
        EXPECT_FALSE(lock->tryLock()) << token;
    }
}

TEST(HostileStore, AbsurdLockTimesAreBounded) {
    Scripted s([=](const HttpRequest&) {
        return answerOf(
            200, {{"lock-token", "<urn:x>"}},
            "<prop xmlns=\"DAV:\"><lockdiscovery><activelock><timeout>Second-99999999999</timeout></activelock>"
            "</lockdiscovery></prop>");
    });
    auto lock = makeStoreLock(*s.manager, s.base.cxURLByAppendingComponent("dateFile"));
    ASSERT_TRUE(lock->tryLock());
    EXPECT_LE(lock->expires().secondsSince(Clock::system().now()), 86400.0);
}

TEST(HostileStore, AVersionStaysUnseenUntilItIsRead) {
    std::string tag = "\"1\"";
    Scripted s([&](const HttpRequest& r) -> std::optional<HttpResponse> {
        if (r.method == "OPTIONS") return kDavOptions;
        if (r.method == "GET") return answerOf(200, {{"etag", tag}}, PropertyList::toXML(Dictionary{{"a", 1}}));
        return answerOf(
            207, {{"date", "Sat, 21 Nov 2026 10:00:00 GMT"}},
            multistatus(response("/dav/alice/Contacts/", true) +
                        response("/dav/alice/Contacts/A%3ACXGroup", false, "<D:getetag>" + tag + "</D:getetag>")));
    });
    const Url group = s.base.cxURLByAppendingComponent("A:CXGroup");
    const auto date = [&] {
        return s.manager->infoForFilesInContainer(s.base)->begin()->second.modificationdate->toHTTP();
    };
    EXPECT_EQ(date(), "Sat, 21 Nov 2026 10:00:05 GMT");
    EXPECT_EQ(date(), "Sat, 21 Nov 2026 10:00:05 GMT") << "listing is not reading";
    s.manager->dictionaryAtURL(group, false, nullptr);
    EXPECT_EQ(date(), "Fri, 20 Nov 2026 23:48:00 GMT");
    tag = "\"2\"";
    EXPECT_EQ(date(), "Sat, 21 Nov 2026 10:00:05 GMT");
}

TEST(HostileStore, APasswordThatCannotBeHadIsTold) {
    TempHome home;
    CXDAVAccount a;
    a.user = UserName("alice");
    a.endpoint = "https://localhost:1/dav/{user}/Contacts";
    a.passwordSource = {PasswordSource::Kind::file, home / "missing"};
    CapturingLog log;
    int told = 0;
    CXFileManager::setFailedPasswordHandler([&] { ++told; });
    CXDAVManager manager(a);
    CXDAVError error;
    EXPECT_FALSE(manager.canReach(error));
    EXPECT_EQ(error.code, kCXDAVErrorNoPassword);
    CXFileManager::setFailedPasswordHandler({});
    EXPECT_EQ(told, 1);
    EXPECT_TRUE(log.mentions("missing"));
}

TEST(HostileStore, NoAccountMeansThatEverythingFails) {
    TempHome home;
    CXDAVManager::setDefaultManager(nullptr);
    EXPECT_EQ(CXDAVManager::vaultraUser(), "");
    EXPECT_EQ(CXDAVManager::vaultraAddress(), "");
    CXDAVError error;
    EXPECT_FALSE(CXDAVManager::canReachOstrelError(error));
    EXPECT_EQ(error.code, kCXDAVErrorNoAccount);
    EXPECT_FALSE(CXDAVManager::defaultManager().sanityCheckPublishStructureCreate(true));
    CXDAVManager::setDefaultManager(nullptr);
}

} // namespace
} // namespace rolvane
