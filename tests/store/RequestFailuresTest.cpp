#include "store/http/RequestFailures.h"
#include "RecordingTransport.h"
#include "store/dav/CXDAVManager.h"

#include <gtest/gtest.h>
#include <string>
#include <thread>
#include <vector>

namespace rolvane::test {
namespace {

HttpResponse saying(const std::string& type, std::string body, int status = 503) {
    return answerOf(status, {{"content-type", type}}, std::move(body));
}

TEST(RequestFailures, AServersWordsAreThoseOfItsPlainTextOrOfItsErrorPage) {
    EXPECT_EQ(serverWords(saying("text/plain; charset=utf-8", "The quota is used up.\r\n")), "The quota is used up.");
    EXPECT_EQ(serverWords(saying("text/html",
                                 "<!DOCTYPE HTML><html><head><title>403 Forbidden</title><style>p{}</style></head>"
                                 "<body><h1>Forbidden</h1><p>You don't have\n permission.</p><!-- <b>x</b> -->"
                                 "<script>var a='<p>';</script></body></html>")),
              "Forbidden You don't have permission.");
    EXPECT_EQ(
        serverWords(saying("text/html", "<html><head><title>Log in &amp; pay</title></head><body></body></html>")),
        "Log in & pay");
    EXPECT_EQ(serverWords(saying("application/xml", "<?xml version=\"1.0\"?><D:error xmlns:D=\"DAV:\">"
                                                    "<m:human-readable>Not &#x6C;ocked.</m:human-readable></D:error>")),
              "Not locked.");
    EXPECT_EQ(serverWords(saying("application/xml", "<?xml version=\"1.0\"?>\n<D:error xmlns:D=\"DAV:\">"
                                                    "<D:lock-token-submitted/><D:other/></D:error>")),
              "lock-token-submitted");
}

TEST(RequestFailures, WithoutWordsOfTheServersThereAreTheTransportsOrNone) {
    HttpResponse lost;
    lost.error = TransportError::unreachable;
    lost.detail = "Connection refused";
    EXPECT_EQ(serverWords(lost), "Connection refused");
    lost.detail.clear();
    EXPECT_EQ(serverWords(lost), description(TransportError::unreachable));
    EXPECT_EQ(serverWords(answerOf(500)), "");
    EXPECT_EQ(serverWords(saying("image/png", "\x89PNG words")), "");
}

TEST(RequestFailures, WordsAreOneLineWithoutMarkupControlsAndTurnedWriting) {
    EXPECT_EQ(serverWords(saying("text/plain", "a\x1b[31mred\x07\n\tb\xE2\x80\xAE gnp.exe\xE2\x80\x8B\xC2\x85"
                                               "c")),
              "a [31mred b gnp.exe c");
    EXPECT_EQ(serverWords(saying("text/html", "<p>&lt;b&gt;fat&lt;/b&gt; &#27;[2J &#x202E;x &#60;i</p>")),
              "b fat /b [2J x i");
    EXPECT_EQ(serverWords(saying("text/html", "<p>an <b unfinished")), "an");
    EXPECT_EQ(serverWords(saying("text/plain", "\xFFz")), "\xEF\xBF\xBDz");
}

TEST(RequestFailures, WordsAreAtMostTwoHundredBytesAndEndBetweenCharacters) {
    std::string umlauts;
    for (int i = 0; i < 300; ++i) umlauts += "\xC3\xA4";
    const std::string words = serverWords(saying("text/plain", umlauts));
    EXPECT_EQ(words, umlauts.substr(0, 196) + "...");
    const std::string fits(200, 'x');
    EXPECT_EQ(serverWords(saying("text/plain", fits)), fits);
    EXPECT_EQ(serverWords(saying("text/plain", fits + "y")), fits.substr(0, 197) + "...");
}

const Url kAlice("http://h/alice/Contacts"), kBob("http://h/bob/Contacts");

RequestFailure failing(const Url& tree, const std::string& file, const std::string& method = "PUT", int status = 403) {
    return {method, tree.cxURLByAppendingComponent(file), status, TransportError::none, {}, {}};
}

TEST(RequestFailures, AreTakenOnceAndInOrder) {
    RequestFailures failures;
    failures.note(failing(kAlice, "1"));
    failures.note(failing(kBob, "2", "GET", 500));
    failures.note(failing(kAlice, "3"));
    const auto all = failures.take();
    ASSERT_EQ(all.size(), 3u);
    EXPECT_EQ(all[0].name.cxLastComponent(), "1");
    EXPECT_EQ(all[1].method, "GET");
    EXPECT_EQ(all[2].name.cxLastComponent(), "3");
    EXPECT_TRUE(failures.take().empty());
}

TEST(RequestFailures, OfAThousandAlikeTheFirstAndTheLastTwentyAreKept) {
    RequestFailures failures;
    for (int i = 0; i < 1000; ++i) failures.note(failing(kAlice, std::to_string(i)));
    failures.note(failing(kBob, "b"));
    const auto all = failures.take();
    ASSERT_EQ(all.size(), 41u);
    EXPECT_EQ(all[0].name.cxLastComponent(), "0");
    EXPECT_EQ(all[19].name.cxLastComponent(), "19");
    EXPECT_EQ(all[20].name.cxLastComponent(), "980");
    EXPECT_EQ(all[39].name.cxLastComponent(), "999");
    EXPECT_EQ(all[40].name.cxLastComponent(), "b");
}

TEST(RequestFailures, KindsWithoutEndAreBoundedToo) {
    RequestFailures failures;
    for (int i = 0; i < 5000; ++i) failures.note(failing(Url("http://h/u" + std::to_string(i) + "/Contacts"), "f"));
    EXPECT_EQ(failures.take().size(), RequestFailures::kKinds + RequestFailures::kFirst + RequestFailures::kLast);
}

TEST(RequestFailures, TheLatestOfATreeIsFoundByItsLocation) {
    RequestFailures failures;
    EXPECT_FALSE(failures.latestBelow(kAlice));
    failures.note(failing(kAlice, "1"));
    failures.note(failing(kAlice, "2", "GET", 500));
    failures.note(failing(kBob, "3"));
    failures.note({"OPTIONS", Url("http://h/alice/Contacts2"), 500, TransportError::none, {}, {}});
    EXPECT_EQ(failures.latestBelow(kAlice)->method, "GET");
    EXPECT_EQ(failures.latestBelow(kBob)->name.cxLastComponent(), "3");
    EXPECT_FALSE(failures.latestBelow(Url("http://h/bo")));
}

TEST(RequestFailures, ManyThreadsMayNote) {
    RequestFailures failures;
    std::vector<std::thread> threads;
    for (int t = 0; t < 8; ++t)
        threads.emplace_back([&, t] {
            for (int i = 0; i < 10; ++i) failures.note(failing(kAlice, "x", "M" + std::to_string(t)));
        });
    for (auto& t : threads) t.join();
    EXPECT_EQ(failures.take().size(), 80u);
}

// A client whose server is a function.
struct FailingStore {
    explicit FailingStore(RecordingTransport::Interceptor answers) : wire(std::make_shared<RecordingTransport>()) {
        wire->intercept(std::move(answers));
        CXDAVAccount account;
        account.user = UserName("alice");
        account.endpoint = "https://dav.example.org/files/{user}/";
        account.nameHost = "contacts.example.org";
        manager = std::make_unique<CXDAVManager>(account, wire);
        base = account.baseLocationFor(account.user);
    }
    std::shared_ptr<RecordingTransport> wire;
    std::unique_ptr<CXDAVManager> manager;
    Url base;
};

TEST(RequestFailures, AFailedWriteIsToldWithItsNameAndTheServersWords) {
    FailingStore store([](const HttpRequest& r) {
        return r.method == "PUT" ? answerOf(507, {{"content-type", "text/plain"}, {"retry-after", "30"}}, "Disk full")
                                 : answerOf(200, {{"dav", "1, 2"}});
    });
    const Url file = store.base.cxURLByAppendingComponent("dateFile");
    EXPECT_FALSE(store.manager->write("x", file, true));
    const auto all = store.manager->failures().take();
    ASSERT_EQ(all.size(), 1u);
    EXPECT_EQ(all[0].method, "PUT");
    EXPECT_EQ(all[0].name, file);
    EXPECT_EQ(all[0].status, 507);
    EXPECT_EQ(all[0].error, TransportError::none);
    EXPECT_EQ(all[0].words, "Disk full");
    EXPECT_EQ(all[0].retryAfterSeconds, 30.0);
}

TEST(RequestFailures, WhatIsExpectedIsNoFailure) {
    FailingStore store([](const HttpRequest& r) {
        if (r.method == "OPTIONS") return answerOf(200, {{"dav", "1, 2"}});
        return answerOf(r.method == "MKCOL" ? 201 : 404);
    });
    const Url file = store.base.cxURLByAppendingComponent("x");
    EXPECT_FALSE(store.manager->dictionaryAtURL(file, true, nullptr));
    EXPECT_TRUE(store.manager->removeFileAtURL(file, nullptr));
    EXPECT_FALSE(store.manager->modDateForURL(file));
    EXPECT_TRUE(store.manager->createDirectoryAtAURL(file));
    EXPECT_TRUE(store.manager->failures().take().empty());
}

TEST(RequestFailures, AStoreThatIsNotThereIsToldForEachRequest) {
    FailingStore store([](const HttpRequest&) {
        HttpResponse lost;
        lost.error = TransportError::unreachable;
        lost.detail = "Could not connect";
        return lost;
    });
    CXDAVError error;
    EXPECT_FALSE(store.manager->canReach(error));
    EXPECT_FALSE(store.manager->infoForFilesInContainer(store.base));
    const auto all = store.manager->failures().take();
    ASSERT_GE(all.size(), 2u);
    EXPECT_EQ(all[0].method, "OPTIONS");
    EXPECT_EQ(all[0].name, store.base);
    EXPECT_EQ(all[0].status, 0);
    EXPECT_EQ(all[0].words, "Could not connect");
    EXPECT_EQ(all.back().method, "PROPFIND");
    EXPECT_EQ(all.back().error, TransportError::unreachable);
}

} // namespace
} // namespace rolvane::test
