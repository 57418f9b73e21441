#include "daemon/NewsWatch.h"

#include "daemon/OwnPasses.h"
#include "daemon/StoreNewsRequest.h"
#include "store/dav/CXDAVManager.h"
#include "support/FakeHttpServer.h"
#include "support/TempHome.h"
#include "support/WaitUntil.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace rolvane::test {
namespace {

using testing::ElementsAre;

// A watch in a world of numbers: what it wants is written down, and time goes by when a test says so.
class Watched {
public:
    Watched() : watch(world()) {}
    void passEnded(bool reached = true) {
        PassResult pass;
        pass.full = true;
        pass.storeAway = !reached;
        watch.passEnded(pass, trees);
    }
    void go(double seconds) {
        const double until = now + seconds;
        while (wakeAt && *wakeAt <= until) {
            now = std::max(now, *wakeAt);
            wakeAt.reset();
            watch.wake();
        }
        now = until;
    }
    void say(NewsLine::Kind kind, size_t tree = 0, const std::string& at = "p") { listener.line({kind, tree, at}); }
    void begin() { say(NewsLine::Kind::begin); }
    void end(int status, bool whole = false) {
        const auto told = listener; // it is replaced
        told.ended({status, whole, "cut"});
    }

    double now = 1000;
    std::optional<double> wakeAt;
    std::vector<Url> trees = {Url("http://store/alice/Contacts"), Url("http://store/bob/Contacts")};
    bool wanted = true, offers = true;
    int opened = 0, standing = 0, news = 0, changes = 0;
    std::string position;
    NewsWatch::Listener listener;

private:
    struct Standing : NewsWatch::Request {
        explicit Standing(int& number) : count(number) { ++count; }
        ~Standing() override { --count; }
        int& count;
    };
    NewsWatch::Collaborators world() {
        NewsWatch::Collaborators w;
        w.now = [this] { return now; };
        w.wakeAt = [this](std::optional<double> at) { wakeAt = at; };
        w.random = [] { return 0.5; };
        w.isWanted = [this] { return wanted; };
        w.open = [this](const std::vector<Url>&, const std::string& from,
                        NewsWatch::Listener toTell) -> std::unique_ptr<NewsWatch::Request> {
            if (!offers) return nullptr;
            ++opened;
            position = from;
            listener = std::move(toTell);
            return std::make_unique<Standing>(standing);
        };
        w.news = [this](double) { ++news; };
        w.livelinessChanged = [this] { ++changes; };
        return w;
    }

public:
    NewsWatch watch;
};

TEST(NewsWatch, HoldsOneRequestOnceAPassHasReachedTheStore) {
    Watched w;
    w.go(1000);
    EXPECT_EQ(w.opened, 0);
    w.passEnded(false);
    EXPECT_EQ(w.opened, 0) << "the store is away";
    w.passEnded();
    EXPECT_EQ(w.opened, 1);
    EXPECT_FALSE(w.watch.isLive()) << "a proxy may keep every line back";
    w.begin();
    EXPECT_TRUE(w.watch.isLive());
    EXPECT_EQ(w.changes, 1);
    w.passEnded();
    w.go(100000);
    EXPECT_EQ(w.opened, 1);
    EXPECT_EQ(w.news, 0);
    w.say(NewsLine::Kind::news, 1, "q");
    EXPECT_EQ(w.news, 1);
    w.say(NewsLine::Kind::still, 0, "r");
    EXPECT_EQ(w.news, 1);
}

TEST(NewsWatch, GoesOnFromThePositionThatItHasHeardLast) {
    Watched w;
    w.passEnded();
    EXPECT_EQ(w.position, "");
    w.begin();
    w.say(NewsLine::Kind::still, 0, "r");
    w.go(1000);
    w.end(200, true);
    EXPECT_EQ(w.standing, 0);
    EXPECT_TRUE(w.watch.isLive()) << "the store has only ended a good answer";
    w.go(NewsWatch::kSpread);
    EXPECT_EQ(w.opened, 2);
    EXPECT_EQ(w.position, "r");
}

TEST(NewsWatch, TakesARightThatHasGoneForNews) {
    Watched w;
    w.passEnded();
    w.begin();
    w.say(NewsLine::Kind::no, 0, "");
    EXPECT_EQ(w.news, 0) << "the pass has just seen it";
    w.go(1000);
    w.end(200, true);
    w.go(NewsWatch::kSpread);
    w.begin();
    w.say(NewsLine::Kind::no, 0, "");
    EXPECT_EQ(w.news, 0) << "it was so before";
    w.say(NewsLine::Kind::no, 1, "");
    EXPECT_EQ(w.news, 1);
}

// How many requests each fault costs in a day, with a pass that reaches the store every five minutes.
int requestsOfADay(const std::function<void(Watched&)>& fault) {
    Watched w;
    for (int i = 0; i < 288; ++i) {
        w.passEnded();
        for (int second = 0; second < 300; ++second) {
            if (w.standing) fault(w);
            w.go(1);
        }
    }
    EXPECT_FALSE(w.watch.isLive());
    EXPECT_EQ(w.news, 0);
    return w.opened;
}

TEST(NewsWatch, AsksWithGrowingPausesAfterEveryFault) {
    for (const int status : {400, 401, 403, 404, 405, 429, 500, 501, 503})
        EXPECT_LE(requestsOfADay([=](Watched& w) { w.end(status); }), 12) << status;
    EXPECT_LE(requestsOfADay([](Watched& w) { w.end(0); }), 40)
        << "cut off before it began, or silent, or no such answer";
    EXPECT_LE(requestsOfADay([](Watched& w) {
                  w.begin();
                  w.end(0);
              }),
              40)
        << "cut off at once";
    EXPECT_LE(requestsOfADay([](Watched& w) {
                  w.begin();
                  w.end(200, true);
              }),
              40)
        << "ended at once";
}

TEST(NewsWatch, AsksAStoreThatIsAwayOnce) {
    Watched w;
    w.passEnded();
    w.begin();
    w.go(100);
    w.end(0);
    w.go(NewsWatch::kSpread);
    EXPECT_EQ(w.opened, 2);
    w.end(0);
    EXPECT_FALSE(w.watch.isLive());
    EXPECT_EQ(w.news, 1) << "a pass is to find out";
    w.go(100000);
    EXPECT_EQ(w.opened, 2) << "a pass is to find the store first";
    EXPECT_EQ(w.news, 1);
    w.passEnded(false);
    w.go(100000);
    EXPECT_EQ(w.opened, 2);
    w.passEnded();
    EXPECT_EQ(w.opened, 3);
}

TEST(NewsWatch, EndsTheRequestWhenNobodyWantsItAndMakesAnotherForOtherTrees) {
    Watched w;
    w.passEnded();
    w.begin();
    w.trees.pop_back();
    w.passEnded();
    EXPECT_EQ(w.opened, 2);
    EXPECT_EQ(w.standing, 1);
    w.trees.clear();
    w.passEnded();
    EXPECT_EQ(w.standing, 0);
    EXPECT_FALSE(w.watch.isLive());
    w.trees = {Url("http://store/alice/Contacts")};
    w.wanted = false;
    w.passEnded();
    EXPECT_EQ(w.standing, 0);
}

TEST(NewsWatch, HoldsNoneWhereTheStoreTellsNoNews) {
    Watched w;
    w.offers = false;
    w.passEnded();
    w.go(10000);
    EXPECT_FALSE(w.watch.isLive());
    w.offers = true;
    w.passEnded();
    EXPECT_EQ(w.opened, 1);
}

TEST(NewsWatch, DoesNotTrustARequestThatStoodBeforeTheNetworkChanged) {
    Watched w;
    w.passEnded();
    w.begin();
    w.watch.networkChanged();
    EXPECT_EQ(w.standing, 0);
    EXPECT_FALSE(w.watch.isLive());
    w.passEnded();
    EXPECT_EQ(w.opened, 2);
}

TEST(LookIntervals, AreHalfAnHourWhileTheStoreTellsNews) {
    EXPECT_EQ(OwnPasses::lookIntervalWithNews(300), 1800);
    EXPECT_EQ(OwnPasses::lookIntervalWithNews(7200), 7200);
    EXPECT_EQ(OwnPasses::lookIntervalWithNews(0), 0) << "never";
}

TEST(PassesForNews, ComeAtOnceAndRestForTwiceTheirLength) {
    RetrySchedule schedule;
    PassResult fine;
    fine.full = true;
    schedule.ended(fine, 100);
    schedule.newsCame(110);
    ASSERT_TRUE(schedule.next(1800));
    EXPECT_EQ(schedule.next(1800)->at, 110);
    schedule.beginsAttempt(110);
    schedule.newsCame(112); // while it is under way
    schedule.ended(fine, 114);
    EXPECT_EQ(schedule.next(1800)->at, 122);
    schedule.beginsAttempt(122);
    schedule.ended(fine, 123);
    EXPECT_EQ(schedule.next(1800)->at, 123 + 1800) << "nothing waits any more";
    schedule.newsCame(200);
    schedule.beginsAttempt(200);
    schedule.newsCame(201);
    schedule.ended(fine, 1200);
    EXPECT_EQ(schedule.next(1800)->at, 1200 + RetrySchedule::kLongestRest);
}

TEST(PassesForNews, AreNoneWhileTheStoreIsAway) {
    RetrySchedule schedule;
    PassResult away;
    away.full = away.left = away.storeAway = true;
    schedule.ended(away, 100);
    schedule.newsCame(101);
    EXPECT_EQ(schedule.next(0)->what, RetrySchedule::What::ask);
}

// -- the request itself, against a server that has every fault

class AskedStore {
public:
    // What REPORT is answered with.
    explicit AskedStore(FakeAnswer toReport)
        : server([answer = std::move(toReport)](const FakeRequest& r) {
              if (r.method == "REPORT") return answer;
              const bool isOptions = r.method == "OPTIONS";
              return FakeAnswer::status(isOptions ? 200 : 404, "",
                                        isOptions ? "DAV: 1, 2\r\nRolvane-News: /dav/ first\r\n" : "");
          }) {
        CXDAVAccount account;
        account.user = UserName("bob");
        account.endpoint = server.origin() + "/dav/{user}/Contacts";
        account.plainLoopback = true;
        client = std::make_unique<CXDAVManager>(account);
        tree = account.baseLocationFor(UserName("alice"));
    }
    void wait(double silentSeconds = 20) {
        CXDAVError error;
        client->canReach(error);
        request = StoreNewsRequest::open(
            RunLoop::current(), *client, {Url("http://elsewhere/x/Contacts"), tree}, "",
            {[this](const NewsLine& line) { lines.push_back(line); }, [this](const NewsEnd& how) { end = how; }},
            {silentSeconds, 3600});
    }
    bool hasEnded() const { return end.has_value(); }

    TempHome home;
    FakeHttpServer server;
    std::unique_ptr<CXDAVManager> client;
    Url tree;
    std::unique_ptr<NewsWatch::Request> request;
    std::vector<NewsLine> lines;
    std::optional<NewsEnd> end;
};

FakeAnswer chunked(const std::vector<std::string>& texts, bool whole, bool closes = true) {
    std::string bytes = "HTTP/1.1 200 OK\r\nContent-Type: text/plain\r\nTransfer-Encoding: chunked\r\n\r\n";
    char size[16];
    for (const std::string& text : texts) {
        std::snprintf(size, sizeof size, "%zx\r\n", text.size());
        bytes += size + text + "\r\n";
    }
    return FakeAnswer::raw(bytes + (whole ? "0\r\n\r\n" : ""), closes);
}

TEST(WaitingForNews, TellsTheLinesByTheTreesThatWereNamed) {
    AskedStore store(chunked({"begin a 45\nne", "ws 1 b\nstill c\n"}, true));
    store.wait();
    ASSERT_TRUE(store.request);
    ASSERT_TRUE(waitUntil([&] { return store.hasEnded(); }, "the end"));
    using Kind = NewsLine::Kind;
    EXPECT_THAT(store.lines, ElementsAre(NewsLine{Kind::begin, 1, "a"}, NewsLine{Kind::news, 1, "b"},
                                         NewsLine{Kind::still, 1, "c"}));
    EXPECT_TRUE(store.end->whole);
    const auto asked = store.server.requests().back();
    EXPECT_EQ(asked.method, "REPORT");
    EXPECT_EQ(asked.target, "/dav/");
    EXPECT_THAT(asked.body, testing::HasSubstr("<D:href>/dav/alice/Contacts/</D:href>"));
    EXPECT_THAT(asked.body, testing::HasSubstr("<R:since>first</R:since>"));
    EXPECT_THAT(asked.body, testing::Not(testing::HasSubstr("elsewhere")));
}

TEST(WaitingForNews, EndsAtEveryFaultAndTellsNothing) {
    const std::pair<const char*, FakeAnswer> faults[] = {
        {"refused", FakeAnswer::status(501)},
        {"absent", FakeAnswer::status(404)},
        {"password", FakeAnswer::status(401)},
        {"a limit", FakeAnswer::status(429, "", "Retry-After: 100000\r\n")},
        {"a portal", FakeAnswer::status(200, "<html>Pay</html>")},
        {"empty", FakeAnswer::status(200)},
        {"nonsense", chunked({"hello\n"}, false, false)},
        {"news before the beginning", chunked({"news 1 a\n"}, false, false)},
        {"a line without an end", chunked({std::string(5000, 'x')}, false, false)},
        {"cut", FakeAnswer::raw("HTTP/1.1 200 OK\r\nTransfer-Encoding: chunked\r\n\r\n")}};
    for (const auto& [what, answer] : faults) {
        AskedStore store(answer);
        store.wait();
        ASSERT_TRUE(store.request) << what;
        ASSERT_TRUE(waitUntil([&] { return store.hasEnded(); }, what));
        EXPECT_THAT(store.lines, ElementsAre()) << what;
        EXPECT_FALSE(store.end->whole) << what;
    }
}

TEST(WaitingForNews, EndsWhenItIsCutOrSilentBehindItsBeginning) {
    AskedStore cut(chunked({"begin a 45\n"}, false));
    cut.wait();
    ASSERT_TRUE(waitUntil([&] { return cut.hasEnded(); }, "the cut"));
    EXPECT_EQ(cut.lines.size(), 1U);
    EXPECT_FALSE(cut.end->whole);
    AskedStore silent(chunked({"begin a 45\n"}, false, false));
    silent.wait(0.5);
    ASSERT_TRUE(waitUntil([&] { return silent.hasEnded(); }, "the silence"));
    EXPECT_EQ(silent.end->status, 0); // on a slow machine before its beginning has come
    EXPECT_FALSE(silent.end->whole);
    FakeAnswer never;
    never.silent = true;
    AskedStore buffered(never);
    buffered.wait(0.5);
    ASSERT_TRUE(waitUntil([&] { return buffered.hasEnded(); }, "the proxy that keeps everything back"));
    EXPECT_EQ(buffered.end->status, 0);
}

TEST(WaitingForNews, NamesNoTreeThatWasNotAskedAbout) {
    AskedStore store(chunked({"begin a 45\n", "news 2 b\n"}, false, false));
    store.wait();
    ASSERT_TRUE(waitUntil([&] { return store.hasEnded(); }, "the end"));
    EXPECT_EQ(store.lines.size(), 1U);
}

} // namespace
} // namespace rolvane::test
