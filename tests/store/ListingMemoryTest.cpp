#include "store/reads/ListingMemory.h"

#include "RecordingTransport.h"
#include "store/dav/CXDAVManager.h"
#include "support/TempHome.h"

#include <gtest/gtest.h>
#include <map>
#include <rapidcheck/gtest.h>
#include <set>

using namespace rolvane;
using namespace rolvane::test;

namespace {

// A store that tells the members' tags: a tree of buckets with versioned files, and what was asked of it.
struct TaggingStore {
    struct File {
        int version = 0;
        int64_t modified = 1700000000;
    };
    std::map<std::string, std::map<std::string, File>> buckets{{"0", {}}, {"1", {}}, {"2", {}}};
    std::map<std::string, int> changes; // of a bucket; its tag is their number
    std::set<std::string> unsettled, broken;
    bool announces = true;
    std::vector<std::string> listed; // buckets
    int tagsAskedFor = 0;
    std::string contents = "<plist version=\"1.0\"><dict><key>a</key><string>b</string></dict></plist>";

    void put(const std::string& bucket, const std::string& name) {
        ++buckets[bucket][name].version;
        ++changes[bucket];
    }
    void remove(const std::string& bucket, const std::string& name) {
        if (buckets[bucket].erase(name)) ++changes[bucket];
    }

    std::shared_ptr<RecordingTransport> wire() {
        auto made = std::make_shared<RecordingTransport>();
        made->intercept([this](const HttpRequest& r) { return answer(r); });
        return made;
    }
    static CXDAVAccount account() {
        CXDAVAccount a;
        a.user = UserName("alice");
        a.endpoint = "https://store.example.org/dav/{user}/Contacts";
        return a;
    }

private:
    static std::string response(const std::string& href, bool collection, const std::string& properties) {
        return "<D:response><D:href>" + href + "</D:href><D:propstat><D:prop><D:resourcetype>" +
               (collection ? "<D:collection/>" : "") + "</D:resourcetype>" + properties +
               "</D:prop><D:status>HTTP/1.1 200 OK</D:status></D:propstat></D:response>";
    }
    static std::string tagOf(const File& file, const std::string& name) {
        return "\"" + name + "-" + std::to_string(file.version) + "\"";
    }
    std::string membersTag(const std::string& bucket) {
        if (unsettled.contains(bucket)) return {};
        return "<R:members-tag xmlns:R=\"http://rolvane.net/ns/\">" + std::to_string(changes[bucket]) +
               "</R:members-tag>";
    }
    HttpResponse multistatus(const std::string& responses) const {
        return answerOf(207, {{"date", "Tue, 14 Nov 2023 22:15:00 GMT"}},
                        "<?xml version=\"1.0\"?><D:multistatus xmlns:D=\"DAV:\">" + responses + "</D:multistatus>");
    }
    std::optional<HttpResponse> answer(const HttpRequest& r) {
        const std::string tree = "/dav/alice/Contacts", path = r.url.encodedPath();
        if (r.method == "OPTIONS")
            return answerOf(200, {{"dav", announces ? "1,2,<http://rolvane.net/ns/members-tag>" : "1,2"}});
        if (r.method == "GET") {
            const size_t slash = path.rfind('/');
            const std::string name = Url::percentDecode(path.substr(slash + 1)), bucket = path.substr(slash - 1, 1);
            return answerOf(200, {{"etag", tagOf(buckets[bucket][name], name)}}, contents);
        }
        if (r.method != "PROPFIND") return answerOf(500);
        if (path == tree || path == tree + "/")
            return multistatus(response(path, true, "") + response(tree + "/People/", true, ""));
        const bool wantsTags = r.body && r.body->find("members-tag") != std::string::npos;
        tagsAskedFor += wantsTags;
        if (path == tree + "/People/") {
            std::string all = response(path, true, "");
            // Told whether asked for or not: anybody may have set a property of that name.
            for (const auto& [bucket, files] : buckets) all += response(path + bucket + "/", true, membersTag(bucket));
            return multistatus(all);
        }
        const std::string bucket = path.substr(path.size() - 2, 1);
        if (broken.contains(bucket)) return answerOf(500);
        listed.push_back(bucket);
        std::string all = response(path, true, "");
        for (const auto& [name, file] : buckets[bucket])
            all += response(path + name, false,
                            "<D:getlastmodified>Tue, 14 Nov 2023 22:13:20 GMT</D:getlastmodified><D:getcontentlength>" +
                                std::to_string(file.version) + "</D:getcontentlength><D:getetag>" + tagOf(file, name) +
                                "</D:getetag>");
        return multistatus(all);
    }
};

struct Lister {
    explicit Lister(TaggingStore& store) : manager(TaggingStore::account(), store.wire()) {
        CXDAVError error;
        EXPECT_TRUE(manager.canReach(error)) << error.reason;
    }
    std::optional<FileListing> list() { return manager.infoForFilesInContainer(base()); }
    Url base() const { return manager.account().baseLocationFor(UserName("alice")); }
    void read(const std::string& bucket, const std::string& name) {
        Url url = base();
        for (const std::string& part : {std::string("People"), bucket, name}) url = url.cxURLByAppendingComponent(part);
        ASSERT_TRUE(manager.dictionaryAtURL(url, nullptr, false));
    }
    CXDAVManager manager;
};

std::string shown(const std::optional<FileListing>& listing) {
    if (!listing) return "nothing";
    std::string out;
    for (const auto& [path, info] : *listing)
        out += path + " " + info.displayName + " " + info.etag.str() + " " + std::to_string(info.size) + " " +
               (info.modificationdate ? info.modificationdate->toISO8601() : "-") + (info.seen ? " seen\n" : "\n");
    return out;
}

using Names = std::vector<std::string>;

} // namespace

TEST(ListingMemory, ListsTheBucketsOnlyThatHaveChanged) {
    TaggingStore store;
    store.put("0", "a:CXPerson");
    store.put("1", "b:CXPerson");
    Lister lister(store);
    const std::string first = shown(lister.list());
    EXPECT_EQ(store.listed, (Names{"0", "1", "2"}));
    store.listed.clear();
    EXPECT_EQ(shown(lister.list()), first);
    EXPECT_EQ(store.listed, Names{});
    store.put("1", "b:CXPerson");
    store.put("1", "c:CXPerson");
    EXPECT_NE(shown(lister.list()), first);
    EXPECT_EQ(store.listed, Names{"1"});
}

TEST(ListingMemory, ListsEverythingOfAStoreThatDoesNotAnnounceTheTags) {
    TaggingStore store;
    store.announces = false;
    store.put("0", "a:CXPerson");
    Lister lister(store);
    lister.list();
    store.listed.clear();
    lister.list();
    EXPECT_EQ(store.listed, (Names{"0", "1", "2"})) << "a property of that name may be anybody's";
    EXPECT_EQ(store.tagsAskedFor, 0);
}

TEST(ListingMemory, ListsABucketThatHasNoTagAtTheMoment) {
    TaggingStore store;
    store.put("0", "a:CXPerson");
    store.unsettled = {"0"};
    Lister lister(store);
    lister.list();
    store.listed.clear();
    lister.list();
    EXPECT_EQ(store.listed, Names{"0"});
    store.unsettled.clear();
    lister.list();
    EXPECT_EQ(store.listed, (Names{"0", "0"})) << "what was listed without a tag says nothing of the tag";
    lister.list();
    EXPECT_EQ(store.listed, (Names{"0", "0"}));
    store.unsettled = {"0"};
    lister.list();
    EXPECT_EQ(store.listed, (Names{"0", "0", "0"}));
}

TEST(ListingMemory, AVersionThatWasNotReadStaysUnseenInABucketThatIsNotListed) {
    TaggingStore store;
    store.put("0", "a:CXPerson");
    Lister lister(store);
    const auto first = lister.list();
    ASSERT_TRUE(first);
    const std::string path = "/alice/Contacts/People/0/a:CXPerson";
    ASSERT_TRUE(first->contains(path)) << shown(first);
    EXPECT_FALSE(first->at(path).seen);
    const auto again = lister.list();
    EXPECT_FALSE(again->at(path).seen);
    EXPECT_GT(again->at(path).modificationdate->toISO8601(), "2023-11-14T22:15:00") << "behind the listing's own time";
    lister.read("0", "a:CXPerson");
    const auto known = lister.list();
    EXPECT_TRUE(known->at(path).seen);
    EXPECT_EQ(known->at(path).modificationdate->toISO8601().substr(0, 19), "2023-11-14T22:13:20");
    EXPECT_EQ(store.listed, (Names{"0", "1", "2"}));
}

TEST(ListingMemory, AListingThatFailsIsNothingAndSpoilsNothing) {
    TaggingStore store;
    store.put("0", "a:CXPerson");
    store.put("2", "b:CXPerson");
    Lister lister(store);
    const std::string before = shown(lister.list());
    store.put("1", "c:CXPerson");
    store.broken = {"1"};
    EXPECT_EQ(shown(lister.list()), "nothing");
    store.broken.clear();
    store.listed.clear();
    EXPECT_NE(shown(lister.list()), before);
    EXPECT_EQ(store.listed, Names{"1"});
    EXPECT_EQ(shown(lister.list()), shown(Lister(store).list()));
}

TEST(ListingMemory, ForgetsABucketThatIsTooLargeToKeep) {
    ListingMemory memory;
    ListingMemory::Entries large(1);
    large[0].first = Url("http://h/u/Contacts/People/0/x");
    large[0].second.etag = EntityTag(std::string(ListingMemory::kMostBytes, 'x'));
    const Url bucket("http://h/u/Contacts/People/0");
    memory.keep(bucket, "tag", large);
    EXPECT_FALSE(memory.forEach(bucket, "tag", [](const ListingMemory::Member&) {}));
    large[0].second.etag = {};
    memory.keep(bucket, "tag", large);
    EXPECT_TRUE(memory.forEach(bucket, "tag", [](const ListingMemory::Member& m) { EXPECT_EQ(m.encodedName, "x"); }));
    memory.keep(bucket, "", large);
    EXPECT_FALSE(memory.forEach(bucket, "", [](const ListingMemory::Member&) {}));
}

// The literal way is a client that remembers nothing.
RC_GTEST_PROP(ListingMemory, TellsWhatAWholeListingTells, ()) {
    TaggingStore store;
    Lister remembering(store);
    const auto steps =
        *rc::gen::resize(15, rc::gen::container<std::vector<std::tuple<int, int, int>>>(rc::gen::tuple(
                                 rc::gen::inRange(0, 6), rc::gen::inRange(0, 3), rc::gen::inRange(0, 4))));
    for (const auto& [what, bucketNumber, nameNumber] : steps) {
        const std::string bucket = std::to_string(bucketNumber);
        const std::string name = std::string(1, static_cast<char>('a' + nameNumber)) + "%20x:CXPerson";
        if (what <= 1) store.put(bucket, name);
        if (what == 2) store.remove(bucket, name);
        if (what == 3) store.unsettled = {bucket};
        if (what == 4) store.unsettled.clear();
        if (what == 5) store.broken = store.broken.empty() ? std::set<std::string>{bucket} : std::set<std::string>{};
        const auto listing = remembering.list();
        std::set<std::string> broken;
        broken.swap(store.broken);
        const auto whole = Lister(store).list();
        broken.swap(store.broken);
        if (listing || store.broken.empty()) RC_ASSERT(shown(listing) == shown(whole));
    }
}
