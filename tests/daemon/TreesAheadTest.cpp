#include "daemon/TreesAhead.h"

#include "../store/RecordingTransport.h"
#include "store/dav/CXDAVManager.h"
#include "store/reads/ListingMemory.h"
#include "support/WaitUntil.h"

#include <atomic>
#include <condition_variable>
#include <gtest/gtest.h>

namespace rolvane::test {
namespace {

// A store with one contact in one bucket, which tells changes. The bucket's listing is held back when a test says so.
class HoldingStore {
public:
    std::shared_ptr<RecordingTransport> wire() {
        auto made = std::make_shared<RecordingTransport>();
        made->intercept([this](const HttpRequest& r) { return answer(r); });
        return made;
    }
    void hold() { set(_holds, true); }
    void release() { set(_holds, false); }
    bool isAskedForTheBucket() {
        const std::lock_guard guard(_mutex);
        return _waits;
    }

    bool synchronizes = true, givesTokens = true;
    std::atomic<bool> bucketIsBroken = false;
    std::atomic<int> listings = 0, reports = 0;

private:
    void set(bool& what, bool to) {
        const std::lock_guard guard(_mutex);
        what = to;
        _changed.notify_all();
    }
    static HttpResponse multistatus(const std::string& responses) {
        return answerOf(207, {{"date", "Tue, 14 Nov 2023 22:15:00 GMT"}},
                        "<?xml version=\"1.0\"?><D:multistatus xmlns:D=\"DAV:\">" + responses + "</D:multistatus>");
    }
    static std::string response(const std::string& href, const std::string& properties) {
        return "<D:response><D:href>" + href + "</D:href><D:propstat><D:prop>" + properties +
               "</D:prop><D:status>HTTP/1.1 200 OK</D:status></D:propstat></D:response>";
    }
    static std::string collection(const std::string& href) {
        return response(href, "<D:resourcetype><D:collection/></D:resourcetype>");
    }
    std::optional<HttpResponse> answer(const HttpRequest& r) {
        const std::string tree = "/dav/alice/Contacts/", people = tree + "People/", bucket = people + "0/";
        const std::string path = r.url.encodedPath();
        if (r.method == "OPTIONS")
            return answerOf(200, {{"dav", synchronizes ? "1,2,<http://rolvane.net/ns/sync-collection>" : "1,2"}});
        if (r.method == "PUT") return answerOf(204);
        if (r.method == "REPORT") {
            ++reports;
            return multistatus("<D:sync-token>urn:later</D:sync-token>");
        }
        if (r.body && r.body->find("sync-token") != std::string::npos)
            return multistatus(response(tree, givesTokens ? "<D:sync-token>urn:first</D:sync-token>" : ""));
        if (path == tree) return multistatus(collection(tree) + collection(people));
        if (path == people) return multistatus(collection(people) + collection(bucket));
        if (path != bucket) return answerOf(404);
        {
            std::unique_lock lock(_mutex);
            _waits = true;
            _changed.wait(lock, [&] { return !_holds; });
            _waits = false;
        }
        ++listings;
        if (bucketIsBroken) return answerOf(500);
        return multistatus(collection(bucket) +
                           response(bucket + "a:CXPerson", "<D:resourcetype/><D:getetag>\"1\"</D:getetag>"));
    }

    std::mutex _mutex; // guards the following
    std::condition_variable _changed;
    bool _holds = false, _waits = false;
};

struct TreesListedAhead : testing::Test {
    TreesListedAhead() : manager(account(), store.wire()) {}
    static CXDAVAccount account() {
        CXDAVAccount a;
        a.user = UserName("alice");
        a.endpoint = "https://store.example.org/dav/{user}/Contacts";
        return a;
    }
    // As a pass does at its beginning.
    void reach() {
        CXDAVError error;
        ASSERT_TRUE(manager.canReach(error)) << error.reason;
    }
    bool begin() {
        return ahead.begin({tree}, [this] { ++done; });
    }

    HoldingStore store;
    CXDAVManager manager;
    const Url tree = manager.account().baseLocationFor(UserName("alice"));
    RunLoop& loop = RunLoop::current();
    TreesAhead ahead{loop, manager};
    int done = 0;
};

} // namespace

TEST_F(TreesListedAhead, WhatIsWrittenDoesNotWaitForTheListing) {
    reach();
    store.hold();
    ASSERT_TRUE(begin());
    ASSERT_TRUE(waitUntil(
        loop, [&] { return store.isAskedForTheBucket(); }, "the listing"));
    EXPECT_FALSE(begin()) << "one at a time";
    EXPECT_TRUE(manager.write("written meanwhile", tree.cxURLByAppendingComponent("dateFile"), false));
    loop.runOnce(0);
    EXPECT_EQ(done, 0);
    EXPECT_TRUE(manager.isToBeListed(tree)) << "half of a listing is none";
    store.release();
    ASSERT_TRUE(waitUntil(
        loop, [&] { return done == 1; }, "the end of the listing"));
    EXPECT_FALSE(begin()) << "it is known by now";
    const auto listing = manager.infoForFilesInContainer(tree);
    ASSERT_TRUE(listing);
    EXPECT_TRUE(listing->contains("/alice/Contacts/People/0/a:CXPerson"));
    EXPECT_EQ(store.listings, 1) << "the changes alone were asked for";
    EXPECT_EQ(store.reports, 1);
}

TEST_F(TreesListedAhead, AListingThatFailsIsThePassesToMake) {
    reach();
    store.bucketIsBroken = true;
    ASSERT_TRUE(begin());
    ASSERT_TRUE(waitUntil(
        loop, [&] { return done == 1; }, "the end of the listing"));
    EXPECT_TRUE(manager.isToBeListed(tree));
    EXPECT_FALSE(manager.infoForFilesInContainer(tree));
    store.bucketIsBroken = false;
    EXPECT_TRUE(begin()) << "the next pass may have better luck";
    ASSERT_TRUE(waitUntil(
        loop, [&] { return done == 2; }, "the end of the second listing"));
    EXPECT_FALSE(manager.isToBeListed(tree));
}

TEST_F(TreesListedAhead, AListingThatAPassHasMadeMeanwhileStands) {
    reach();
    store.hold();
    ASSERT_TRUE(begin());
    ASSERT_TRUE(waitUntil(
        loop, [&] { return store.isAskedForTheBucket(); }, "the listing"));
    auto other = std::make_unique<ListingMemory>();
    other->keep(tree, ListingMemory::kSynced, {});
    other->keepToken(tree, "urn:of-the-pass");
    EXPECT_TRUE(manager.keepListing(tree, std::move(other)));
    store.release();
    ASSERT_TRUE(waitUntil(
        loop, [&] { return done == 1; }, "the end of the listing"));
    const auto listing = manager.infoForFilesInContainer(tree);
    ASSERT_TRUE(listing);
    EXPECT_TRUE(listing->empty()) << "as the pass has found it";
}

TEST_F(TreesListedAhead, AStoreThatTellsNoChangesIsNotAsked) {
    store.synchronizes = false;
    EXPECT_FALSE(begin()) << "it has not said anything yet";
    reach();
    EXPECT_FALSE(begin());
    EXPECT_EQ(store.listings, 0);
}

TEST_F(TreesListedAhead, AStoreThatGivesNoTokenIsNotAskedAgain) {
    store.givesTokens = false;
    reach();
    ASSERT_TRUE(begin());
    ASSERT_TRUE(waitUntil(
        loop, [&] { return done == 1; }, "the end of the listing"));
    EXPECT_FALSE(begin()) << "nothing of it could be kept";
}

} // namespace rolvane::test
