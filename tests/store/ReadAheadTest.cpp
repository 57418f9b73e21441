#include "store/reads/ReadAhead.h"

#include "ManyContacts.h"
#include "RecordingTransport.h"

#include <gtest/gtest.h>
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
            asked.push_back(request.url.encodedPath());
            limit = request.limits.maxBodyBytes;
            if (atOnce)
                done(answerOf(200, {}, body.empty() ? request.url.encodedPath() : body));
            else
                waiting.emplace_back(request.url.encodedPath(), std::move(done));
        };
    }
    std::vector<std::string> asked;
    std::vector<std::pair<std::string, HttpTransport::Completion>> waiting;
    std::string body;
    size_t limit = 0;
    bool atOnce = true;
};

} // namespace

TEST(ReadAhead, HandsEachAnswerOutOnce) {
    Server server;
    ReadAhead ahead(server.start());
    ahead.expect({file(1), file(2), file(1)});
    EXPECT_EQ(server.asked, (std::vector<std::string>{"/1", "/2"})) << "a repeated one is fetched once";
    EXPECT_EQ(ahead.take(file(1)).value_or(HttpResponse()).body, "/1");
    EXPECT_FALSE(ahead.take(file(1)));
    EXPECT_EQ(ahead.take(file(2)).value_or(HttpResponse()).body, "/2");
    EXPECT_FALSE(ahead.take(file(3))) << "never expected";
}

TEST(ReadAhead, KeepsNoMoreThanAWindowUnderWayAndFillsItAsAnswersAreTaken) {
    Server server;
    ReadAhead ahead(server.start());
    const size_t count = ReadAhead::kWindow * 3;
    ahead.expect(files(count));
    EXPECT_EQ(server.asked.size(), ReadAhead::kWindow);
    for (size_t i = 0; i < count; ++i) {
        ASSERT_TRUE(ahead.take(file(i))) << i;
        EXPECT_LE(server.asked.size(), i + 1 + ReadAhead::kWindow);
    }
    EXPECT_EQ(server.asked.size(), count);
}

TEST(ReadAhead, AReaderThatLeavesSomeOutDoesNotStopTheRest) {
    Server server;
    ReadAhead ahead(server.start());
    const size_t count = ReadAhead::kWindow * 3;
    ahead.expect(files(count));
    EXPECT_TRUE(ahead.take(file(ReadAhead::kWindow - 1)));
    EXPECT_EQ(server.asked.size(), ReadAhead::kWindow * 2);
    EXPECT_FALSE(ahead.take(file(count - 1))) << "far ahead of the window: the reader fetches it itself";
    EXPECT_FALSE(ahead.take(file(0))) << "let go of";
}

TEST(ReadAhead, StartsNoneWhileManyBytesWait) {
    Server server;
    server.body = std::string(1u << 20, 'x');
    ReadAhead ahead(server.start());
    ahead.expect(files(ReadAhead::kWindow));
    const size_t first = server.asked.size();
    EXPECT_EQ(first, ReadAhead::kWaitingBytes >> 20);
    EXPECT_TRUE(ahead.take(file(0)));
    EXPECT_EQ(server.asked.size(), first + 1);
    EXPECT_EQ(server.limit, ReadAhead::kLargestAnswer);
}

TEST(ReadAhead, AnAnswerThatDidNotComeWholeIsNotHandedOut) {
    Server server;
    server.atOnce = false;
    ReadAhead ahead(server.start());
    ahead.expect({file(1)});
    HttpResponse broken;
    broken.error = TransportError::tooLarge;
    server.waiting[0].second(broken);
    EXPECT_FALSE(ahead.take(file(1)));
}

TEST(ReadAhead, WhatChangesMeanwhileIsNotHandedOut) {
    Server server;
    ReadAhead ahead(server.start());
    ahead.expect({file(1), file(2)});
    ahead.forget(file(1));
    EXPECT_FALSE(ahead.take(file(1)));
    EXPECT_TRUE(ahead.take(file(2)));
}

TEST(ReadAhead, ATakerWaitsForTheAnswerThatIsUnderWay) {
    Server server;
    server.atOnce = false;
    ReadAhead ahead(server.start());
    ahead.expect({file(1)});
    std::optional<HttpResponse> answer;
    std::thread taker([&] { answer = ahead.take(file(1)); });
    server.waiting[0].second(answerOf(200, {}, "late"));
    taker.join();
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->body, "late");
}

TEST(ReadAhead, AnswersThatComeAfterTheEndHarmNobody) {
    Server server;
    server.atOnce = false;
    {
        ReadAhead ahead(server.start());
        ahead.expect({file(1), file(2)});
        ahead.expect({});
        EXPECT_FALSE(ahead.take(file(1)));
    }
    for (auto& [path, done] : server.waiting) done(answerOf(200));
}

// -- through a client of a real store

namespace {

struct ReadingAhead : ManyContacts<ReadingAhead> {};

} // namespace

TEST_F(ReadingAhead, EveryExpectedFileIsFetchedOnceAndASecondReadGoesToTheStore) {
    client.manager.expectReads(all(), true);
    readAll();
    EXPECT_EQ(client.wire->count("GET"), 300u);
    EXPECT_TRUE(client.manager.dictionaryAtURL(client.at(name(7)), true, nullptr));
    EXPECT_EQ(client.wire->count("GET"), 301u);
}

TEST_F(ReadingAhead, WhatIsWrittenMeanwhileIsReadAnew) {
    client.manager.expectReads({client.at(name(1)), client.at(name(2))}, true);
    ASSERT_EQ(client.write(name(1), Dictionary{{"number", "new"}}), 204);
    EXPECT_EQ((*client.manager.dictionaryAtURL(client.at(name(1)), true, nullptr))["number"], Value("new"));
    client.manager.expectReads({}, true);
}

TEST_F(ReadingAhead, AFileThatIsGoneIsNotFoundAndOneThatFailedIsAskedForAgain) {
    client.manager.removeFileAtURL(client.at(name(1)), nullptr);
    std::atomic<int> failures{1};
    client.wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        if (request.method != "GET" || failures-- <= 0) return std::nullopt;
        HttpResponse none;
        none.error = TransportError::timedOut;
        return none;
    });
    client.manager.expectReads({client.at(name(2)), client.at(name(1))}, true);
    EXPECT_TRUE(client.manager.dictionaryAtURL(client.at(name(2)), true, nullptr));
    int code = 0;
    EXPECT_FALSE(client.manager.dictionaryAtURL(client.at(name(1)), true, &code));
    EXPECT_EQ(code, 404);
}

// -- the groups of a snapshot

TEST_F(ReadingAhead, DuringASnapshotAGroupThatHasNotChangedIsNotFetched) {
    ASSERT_EQ(client.write("G:CXGroup", Dictionary{{"memberUIDState", Array{"a"}}}), 201);
    Client other(*world);
    const auto snapshot = [&] {
        const CXDAVManager::Snapshot unchanged(other.manager);
        EXPECT_TRUE(other.manager.infoForFilesInContainer(other.base));
        other.wire->clear();
        return other.read("G:CXGroup").second.value_or(Dictionary());
    };
    EXPECT_EQ(snapshot()["memberUIDState"], Value(Array{"a"}));
    EXPECT_EQ(other.wire->count("GET"), 1u) << other.wire->text();
    snapshot()["memberUIDState"].array().append("mine");
    EXPECT_EQ(other.wire->count("GET"), 0u) << other.wire->text();
    EXPECT_EQ(snapshot()["memberUIDState"], Value(Array{"a"})) << "what a reader does to its copy stays with it";
    other.read("G:CXGroup");
    EXPECT_EQ(other.wire->count("GET"), 1u) << "outside of a snapshot the store is asked";

    ASSERT_EQ(client.write("G:CXGroup", Dictionary{{"memberUIDState", Array{"a", "b"}}}), 204);
    EXPECT_EQ(snapshot()["memberUIDState"], Value(Array{"a", "b"}));
    EXPECT_EQ(other.wire->count("GET"), 1u) << other.wire->text();
    client.manager.removeFileAtURL(client.at("G:CXGroup"), nullptr);
}

TEST_F(ReadingAhead, AGroupThatThisClientWroteItselfIsNotReadBack) {
    ASSERT_EQ(client.write("H:CXGroup", Dictionary{{"memberUIDState", Array{"a"}}}), 201);
    {
        const CXDAVManager::Snapshot unchanged(client.manager);
        ASSERT_TRUE(client.manager.infoForFilesInContainer(client.base));
        client.wire->clear();
        EXPECT_EQ((*client.read("H:CXGroup").second)["memberUIDState"], Value(Array{"a"}));
    }
    EXPECT_EQ(client.wire->text(), "");
    client.manager.removeFileAtURL(client.at("H:CXGroup"), nullptr);
}

TEST_F(ReadingAhead, AVersionThatWasNeverReadIsDatedBehindTheListingsOwnDate) {
    Client other(*world);
    const auto before = other.manager.modDateForURL(other.at(name(3)));
    const auto dateOf = [&] {
        return *other.manager.infoForFilesInContainer(other.base)->at("/alice/Contacts/" + name(3)).modificationdate;
    };
    EXPECT_GT(dateOf().secondsSince(*before), 4.0) << "whoever leaves a margin of four seconds still sees it";
    other.read(name(3));
    EXPECT_EQ(dateOf(), *before);
}
