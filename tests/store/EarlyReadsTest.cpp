#include "store/reads/EarlyReads.h"

#include "ManyContacts.h"
#include "RecordingTransport.h"
#include "support/FakeHttpServer.h"

#include <algorithm>
#include <future>
#include <gtest/gtest.h>
#include <map>
#include <thread>

using namespace rolvane;
using namespace rolvane::test;

namespace {

Url file(size_t number) {
    return Url("http://localhost/" + std::to_string(number));
}
std::vector<Url> files(size_t count) {
    std::vector<Url> all;
    for (size_t i = 0; i < count; ++i) all.push_back(file(i));
    return all;
}

// Requests under way, answered when the test says so; the body of an answer is the URL's path.
struct Server {
    ReadAhead::Start start() {
        return [this](const HttpRequest& request, HttpTransport::Completion done) {
            givesWay = request.givesWay;
            asked.push_back(request.url.encodedPath());
            if (atOnce)
                done(answerOf(200, {}, body.empty() ? request.url.encodedPath() : body));
            else
                waiting.push_back(std::move(done));
        };
    }
    void answer(size_t number) { waiting[number](answerOf(200, {}, asked[number])); }
    std::vector<std::string> asked;
    std::vector<HttpTransport::Completion> waiting;
    std::string body;
    bool atOnce = true, givesWay = false;
};

} // namespace

TEST(EarlyReads, HandsEachAnswerOutOnceInWhateverOrder) {
    Server server;
    EarlyReads early(server.start());
    early.add({file(1), file(2), file(1)});
    early.add({file(3), file(2)});
    EXPECT_EQ(server.asked, (std::vector<std::string>{"/1", "/2", "/3"})) << "a repeated one is fetched once";
    EXPECT_TRUE(server.givesWay);
    for (const size_t number : {3u, 1u, 2u}) {
        EXPECT_EQ(early.take(file(number)).value_or(HttpResponse()).body, "/" + std::to_string(number));
        EXPECT_FALSE(early.take(file(number)));
    }
    EXPECT_FALSE(early.take(file(4))) << "never expected";
}

TEST(EarlyReads, KeepsTheNumberUnderWayAndHeldBounded) {
    Server server;
    server.atOnce = false;
    EarlyReads early(server.start());
    early.add(files(EarlyReads::kHeld * 2));
    EXPECT_EQ(server.asked.size(), EarlyReads::kUnderWay);
    for (size_t i = 0; i < server.asked.size(); ++i) {
        server.answer(i);
        EXPECT_LE(server.asked.size(), i + 1 + EarlyReads::kUnderWay);
    }
    EXPECT_EQ(server.asked.size(), EarlyReads::kHeld) << "nobody has taken one";
    EXPECT_TRUE(early.take(file(7)));
    early.add({file(EarlyReads::kHeld), file(EarlyReads::kHeld + 1)});
    EXPECT_EQ(server.asked.size(), EarlyReads::kHeld + 1) << "the place of the one that was taken";
}

TEST(EarlyReads, ManyAnswersThatComeAtOnceAreNoneTheFewer) {
    Server server;
    EarlyReads early(server.start());
    early.add(files(EarlyReads::kHeld * 2));
    EXPECT_EQ(server.asked.size(), EarlyReads::kHeld);
    EXPECT_TRUE(early.take(file(EarlyReads::kHeld - 1)));
}

TEST(EarlyReads, StartsNoneWhileManyBytesWait) {
    Server server;
    server.body = std::string(1u << 20, 'x');
    EarlyReads early(server.start());
    early.add(files(EarlyReads::kHeld));
    const size_t first = server.asked.size();
    EXPECT_EQ(first, EarlyReads::kWaitingBytes >> 20);
    EXPECT_TRUE(early.take(file(0)));
    EXPECT_EQ(server.asked.size(), first + 1);
}

TEST(EarlyReads, WhatIsClaimedWasBegunOrNeverWillBe) {
    Server server;
    server.atOnce = false;
    EarlyReads early(server.start());
    early.add(files(EarlyReads::kUnderWay + 2));
    EXPECT_TRUE(early.claim(file(0)));
    EXPECT_FALSE(early.claim(file(EarlyReads::kUnderWay)));
    EXPECT_FALSE(early.claim(Url("http://localhost/other")));
    server.answer(0);
    server.answer(1);
    EXPECT_EQ(server.asked.size(), EarlyReads::kUnderWay + 1) << "the one behind the claimed one";
    EXPECT_EQ(server.asked.back(), "/" + std::to_string(EarlyReads::kUnderWay + 1));
    EXPECT_TRUE(early.claim(file(0))) << "arrived, and not taken";
    EXPECT_TRUE(early.take(file(0)));
    EXPECT_FALSE(early.claim(file(0)));
}

TEST(EarlyReads, AnAnswerThatDidNotComeWholeIsNotHandedOut) {
    Server server;
    server.atOnce = false;
    EarlyReads early(server.start());
    early.add({file(1)});
    HttpResponse broken;
    broken.error = TransportError::timedOut;
    server.waiting[0](broken);
    EXPECT_FALSE(early.take(file(1)));
}

TEST(EarlyReads, WhatChangesMeanwhileIsNotHandedOutEvenToOneWhoWaits) {
    Server server;
    server.atOnce = false;
    EarlyReads early(server.start());
    early.add({file(1), file(2)});
    early.forget(file(1));
    server.answer(0);
    EXPECT_FALSE(early.take(file(1)));
    auto taken = std::async(std::launch::async, [&] { return early.take(file(2)); });
    early.forget(file(2));
    EXPECT_FALSE(taken.get());
    server.answer(1);
}

TEST(EarlyReads, ATakerWaitsForTheAnswerThatIsUnderWay) {
    Server server;
    server.atOnce = false;
    EarlyReads early(server.start());
    early.add({file(1)});
    auto taken = std::async(std::launch::async, [&] { return early.take(file(1)); });
    server.answer(0);
    EXPECT_EQ(taken.get().value_or(HttpResponse()).body, "/1");
}

TEST(EarlyReads, AnswersThatComeAfterTheEndHarmNobody) {
    Server server;
    server.atOnce = false;
    {
        EarlyReads early(server.start());
        early.add(files(EarlyReads::kUnderWay + 5));
        early.clear();
        EXPECT_FALSE(early.take(file(1)));
    }
    const size_t asked = server.asked.size();
    for (size_t i = 0; i < asked; ++i) server.answer(i);
    EXPECT_EQ(server.asked.size(), asked);
}

// -- the transport

TEST(EarlyReads, WhatGivesWayGoesBehindWhatSomebodyWaitsFor) {
    std::promise<void> arrived, mayAnswer;
    auto answering = mayAnswer.get_future().share();
    FakeHttpServer server([&](const FakeRequest& request) {
        if (request.target == "/first") {
            arrived.set_value();
            answering.wait();
        }
        return FakeAnswer::status(200);
    });
    CurlTransportOptions options;
    options.maxConnections = 1;
    CurlTransport transport(options);
    std::vector<std::future<void>> done;
    const auto ask = [&](const std::string& path, bool givesWay) {
        auto ready = std::make_shared<std::promise<void>>();
        done.push_back(ready->get_future());
        HttpRequest request;
        request.method = "GET";
        request.url = Url(server.origin() + path);
        request.givesWay = givesWay;
        transport.start(std::move(request), [ready](const HttpResponse&) { ready->set_value(); });
    };
    ask("/first", true);
    arrived.get_future().wait(); // the one connection is taken
    ask("/later", true);
    ask("/latest", true);
    ask("/now", false);
    ask("/soon", false);
    mayAnswer.set_value();
    for (auto& each : done) each.wait();
    std::vector<std::string> order;
    for (const FakeRequest& request : server.requests()) order.push_back(request.target);
    EXPECT_EQ(order, (std::vector<std::string>{"/first", "/now", "/soon", "/later", "/latest"}));
}

// -- through a client of a real store

namespace {

struct ReadingEarly : ManyContacts<ReadingEarly> {};

} // namespace

TEST_F(ReadingEarly, TheOrderThatIsToldLaterFetchesNothingTwice) {
    std::vector<Url> backwards = all();
    std::reverse(backwards.begin(), backwards.end());
    client.manager.expectSomeReads(backwards, true);
    client.manager.expectReads(all(), true);
    readAll();
    EXPECT_EQ(client.wire->count("GET"), 300u);
}

TEST_F(ReadingEarly, WhatIsWrittenMeanwhileIsReadAnew) {
    client.manager.expectSomeReads({client.at(name(1))}, true);
    ASSERT_EQ(client.write(name(1), Dictionary{{"number", "new"}}), 204);
    EXPECT_EQ((*client.manager.dictionaryAtURL(client.at(name(1)), true, nullptr))["number"], Value("new"));
}

TEST_F(ReadingEarly, WhatIsForgottenIsReadAnew) {
    client.manager.expectSomeReads({client.at(name(1))}, true);
    client.manager.expectNothing();
    Client other(*world);
    ASSERT_EQ(other.write(name(1), Dictionary{{"number", "new"}}), 204);
    EXPECT_EQ((*client.manager.dictionaryAtURL(client.at(name(1)), true, nullptr))["number"], Value("new"));
}

TEST_F(ReadingEarly, AListingTellsItsPartsOnTheWayAndEachEntryOnce) {
    FileListing told;
    size_t parts = 0, entries = 0;
    const auto listing = client.manager.infoForFilesInContainerByParts(client.base, [&](const FileListing& part) {
        ++parts;
        entries += part.size();
        told.insert(part.begin(), part.end());
    });
    ASSERT_TRUE(listing);
    EXPECT_EQ(parts, 32u);
    EXPECT_EQ(entries, 300u);
    EXPECT_EQ(told.size(), 300u);
    for (const auto& [path, info] : told) {
        ASSERT_TRUE(listing->contains(path)) << path;
        EXPECT_EQ(listing->at(path).etag, info.etag);
    }
    EXPECT_EQ(listing->size(), client.manager.infoForFilesInContainer(client.base)->size());
}

TEST_F(ReadingEarly, AListingWithABucketThatFailsIsNothingWhateverPartsWereTold) {
    client.wire->intercept([](const HttpRequest& request) {
        return request.url.path().ends_with("/People/7/") ? std::optional(answerOf(500)) : std::nullopt;
    });
    const auto listing = client.manager.infoForFilesInContainerByParts(client.base, [](const FileListing& part) {
        for (const auto& [path, info] : part) EXPECT_EQ(path.find("/People/7/"), std::string::npos);
    });
    EXPECT_FALSE(listing);
    client.wire->intercept(nullptr);
    EXPECT_TRUE(client.manager.infoForFilesInContainer(client.base)) << "the next one asks again";
}

TEST_F(ReadingEarly, AListingThatWasBegunAsksNothingTwiceAndServesOneListing) {
    Client fresh(*world); // nobody has told it yet that the store tells changes
    fresh.manager.expectListing(fresh.base);
    const auto begun = fresh.manager.infoForFilesInContainer(fresh.base);
    std::map<std::string, size_t> asked; // the tree itself is asked for its token, too, where that is known in time
    for (const auto& exchange : fresh.wire->exchanges())
        if (exchange.method == "PROPFIND") ++asked[exchange.path];
    EXPECT_EQ(asked.size(), 34u) << fresh.wire->text();
    for (const auto& [path, times] : asked) EXPECT_LE(times, path.ends_with("/Contacts/") ? 2u : 1u) << path;
    fresh.wire->clear();
    Client other(*world);
    ASSERT_EQ(other.write("People/7/new:CXPerson", Dictionary{{"number", 1}}), 201);
    const auto later = fresh.manager.infoForFilesInContainer(fresh.base);
    ASSERT_TRUE(begun && later);
    EXPECT_EQ(later->size(), begun->size() + 1) << "the store is asked again";
    other.manager.removeFileAtURL(other.at("People/7/new:CXPerson"), nullptr);
}

// Of a store that tells no changes: elsewhere the listing begins with a question for the token.
TEST_F(ReadingEarly, AListingThatFailedWhenItWasBegunIsNothing) {
    Client fresh(*world);
    fresh.wire->intercept([](const HttpRequest& request) -> std::optional<HttpResponse> {
        if (request.method == "PROPFIND") return answerOf(500);
        if (request.method != "OPTIONS") return std::nullopt;
        HttpResponse plain = answerOf(200);
        plain.headers = {{"dav", "1,2"}, {"allow", "OPTIONS,GET,PUT,PROPFIND"}};
        return plain;
    });
    ASSERT_EQ(fresh.manager.keepsAccessLists(), std::optional(false));
    fresh.manager.expectListing(fresh.base);
    fresh.wire->intercept(nullptr);
    EXPECT_FALSE(fresh.manager.infoForFilesInContainer(fresh.base));
    EXPECT_TRUE(fresh.manager.infoForFilesInContainer(fresh.base));
}

TEST_F(ReadingEarly, ATokenThatCouldNotBeHadCostsTheTokenAndNotTheListing) {
    Client fresh(*world);
    fresh.wire->intercept([](const HttpRequest& request) {
        return request.method == "PROPFIND" ? std::optional(answerOf(500)) : std::nullopt;
    });
    fresh.manager.expectListing(fresh.base);
    fresh.wire->intercept(nullptr);
    EXPECT_TRUE(fresh.manager.infoForFilesInContainer(fresh.base));
}
