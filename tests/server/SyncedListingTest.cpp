#include "server/mod_davacl/TreeJournal.h"
#include "store/dav/CXDAVManager.h"

#include "../store/RecordingTransport.h"
#include "StoreTestWorld.h"
#include "support/TempHome.h"

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <gtest/gtest.h>
#include <random>
#include <sys/stat.h>

using namespace rolvane;
using namespace rolvane::test;
namespace fs = std::filesystem;

namespace {

// A store that serves a directory and tells its changes by the journal that the module has, without httpd around it.
struct DiskStore {
    StoreDirectory home;
    const fs::path tree = home.path("Contacts");
    size_t limit = 5000;
    int refusal = 0; // of the next report
    std::map<std::string, int> asked;

    DiskStore() { fs::create_directories(tree / "People"); }
    std::shared_ptr<RecordingTransport> wire(bool synchronizes) {
        auto made = std::make_shared<RecordingTransport>();
        made->intercept([this, synchronizes](const HttpRequest& r) -> std::optional<HttpResponse> {
            if (r.method != "OPTIONS") return answer(r);
            return answerOf(200, {{"dav", synchronizes ? "1,2,<http://rolvane.net/ns/sync-collection>" : "1,2"}});
        });
        return made;
    }
    // As httpd does.
    void put(const std::string& name, const std::string& text) const {
        std::error_code ignored;
        std::ofstream(home.path("upload")) << text;
        fs::rename(home.path("upload"), tree / name, ignored);
    }

private:
    static constexpr const char* kBase = "/dav/alice/Contacts";

    std::string response(const std::string& below) const {
        const fs::path file = below.empty() ? tree : tree / below;
        struct stat s {};
        if (stat(file.c_str(), &s) != 0) return bare(below, "404 Not Found");
        const bool isCollection = S_ISDIR(s.st_mode);
        std::string properties = "<D:getlastmodified>" + Date(static_cast<double>(s.st_mtim.tv_sec)).toHTTP() +
                                 "</D:getlastmodified><D:resourcetype>" + (isCollection ? "<D:collection/>" : "") +
                                 "</D:resourcetype>";
        if (!isCollection) {
            std::ifstream in(file);
            const std::string text{std::istreambuf_iterator<char>(in), {}};
            properties += "<D:getetag>\"" + text + "\"</D:getetag><D:getcontentlength>" + std::to_string(text.size()) +
                          "</D:getcontentlength>";
        }
        return "<D:response><D:href>" + href(below) + (isCollection ? "/" : "") + "</D:href><D:propstat><D:prop>" +
               properties + "</D:prop><D:status>HTTP/1.1 200 OK</D:status></D:propstat></D:response>";
    }
    static std::string href(const std::string& below) { return kBase + (below.empty() ? "" : "/" + below); }
    static std::string bare(const std::string& below, const std::string& status) {
        return "<D:response><D:href>" + href(below) + "</D:href><D:status>HTTP/1.1 " + status +
               "</D:status></D:response>";
    }
    static HttpResponse multistatus(const std::string& responses) {
        return answerOf(207, {{"date", "Tue, 14 Nov 2023 22:15:00 GMT"}},
                        "<?xml version=\"1.0\"?><D:multistatus xmlns:D=\"DAV:\">" + responses + "</D:multistatus>");
    }
    davacl::TreeJournal::Answer look(const std::optional<davacl::SyncToken>& from, bool wantsChanges) const {
        using namespace std::chrono;
        davacl::TreeJournal::Question q;
        q.path = tree;
        q.below = {"Contacts"};
        q.isDeep = true;
        q.shows = [](const std::vector<std::string>&) { return true; };
        q.from = from;
        q.wantsChanges = wantsChanges;
        q.limit = limit;
        q.now = duration_cast<nanoseconds>(system_clock::now().time_since_epoch()).count();
        q.settle = 50000000;
        return davacl::TreeJournal(home.path("alice.sync")).changes(q);
    }
    HttpResponse report(const std::string& body) {
        if (refusal) return answerOf(std::exchange(refusal, 0));
        const std::string open = "<sync-token>";
        const size_t at = body.find(open) + open.size();
        const auto from = davacl::SyncToken::parse(body.substr(at, body.find('<', at) - at));
        if (!from) return answerOf(403);
        const auto found = look(from, true);
        if (found.outcome != davacl::TreeJournal::Outcome::told) return answerOf(403);
        std::string all;
        for (const auto& change : found.changes)
            all += change.isGone ? bare(change.path, "404 Not Found") : response(change.path);
        if (found.token.cut) all += bare("", "507 Insufficient Storage");
        return multistatus(all + "<D:sync-token>" + found.token.text() + "</D:sync-token>");
    }
    std::optional<HttpResponse> answer(const HttpRequest& r) {
        ++asked[r.method];
        std::string below = Url::percentDecode(r.url.encodedPath().substr(std::string(kBase).size()));
        while (below.starts_with('/')) below.erase(0, 1);
        while (below.ends_with('/')) below.pop_back();
        if (r.method == "REPORT") return report(*r.body);
        if (r.method != "PROPFIND") return answerOf(500);
        if (r.body && r.body->find("<sync-token/>") != std::string::npos)
            return multistatus(
                "<D:response><D:href>" + href(below) + "/</D:href><D:propstat><D:prop><D:sync-token>" +
                look({}, false).token.text() +
                "</D:sync-token></D:prop><D:status>HTTP/1.1 200 OK</D:status></D:propstat></D:response>");
        const fs::path file = below.empty() ? tree : tree / below;
        if (!fs::exists(file)) return answerOf(404);
        std::string all = response(below);
        const auto isDeep = [](const auto& header) { return header.first == "Depth" && header.second == "1"; };
        if (std::any_of(r.headers.begin(), r.headers.end(), isDeep) && fs::is_directory(file))
            for (const auto& entry : fs::directory_iterator(file))
                all += response(entry.path().lexically_relative(tree));
        return multistatus(all);
    }
};

struct Client {
    Client(DiskStore& store, bool synchronizes, const std::string& memory = {})
        : manager(account(), store.wire(synchronizes), CXDAVManager::VersionsFile{memory}) {
        CXDAVError error;
        EXPECT_TRUE(manager.canReach(error)) << error.reason;
    }
    static CXDAVAccount account() {
        CXDAVAccount a;
        a.user = UserName("alice");
        a.endpoint = "https://store.example.org/dav/{user}/Contacts";
        return a;
    }
    std::string shown() {
        const auto listing = manager.infoForFilesInContainer(manager.account().baseLocationFor(UserName("alice")));
        if (!listing) return "nothing";
        std::string out;
        for (const auto& [path, info] : *listing)
            out += path + " " + info.displayName + " " + info.etag.str() + " " + std::to_string(info.size) +
                   (info.modificationdate ? " " + info.modificationdate->toISO8601() : " -") +
                   (info.stored ? " " + info.stored->toISO8601() : " -") + (info.isCollection ? " collection" : "") +
                   (info.seen ? " seen\n" : "\n");
        return out;
    }
    // As at the end of a pass.
    void save() { manager.saveVersionMemory("database", 1); }
    CXDAVManager manager;
};

} // namespace

TEST(SyncedListing, CostsOneRequestHoweverLargeTheTreeIs) {
    DiskStore store;
    for (int i = 0; i < 20; ++i) {
        const std::string bucket = "People/" + std::to_string(i);
        fs::create_directory(store.tree / bucket);
        store.put(bucket + "/a:CXPerson", "one");
    }
    fs::create_directory(store.tree / "1:CXGroup");
    store.put("1:CXGroup/state", "group");
    Client client(store, true);
    const std::string first = client.shown();
    EXPECT_EQ(store.asked["REPORT"], 0);
    const int before = store.asked["PROPFIND"];
    EXPECT_EQ(client.shown(), first);
    store.put("People/7/b:CXPerson", "two");
    const std::string second = client.shown();
    EXPECT_NE(second.find("/alice/Contacts/People/7/b:CXPerson b:CXPerson \"two\" 3"), std::string::npos) << second;
    EXPECT_EQ(store.asked["REPORT"], 2);
    EXPECT_EQ(store.asked["PROPFIND"], before) << "nothing is listed";
}

TEST(SyncedListing, OfAProcessThatStartsAsksForWhatHasChangedSinceTheLastOne) {
    DiskStore store;
    for (int i = 0; i < 20; ++i) {
        const std::string bucket = "People/" + std::to_string(i);
        fs::create_directory(store.tree / bucket);
        store.put(bucket + "/a:CXPerson", "one");
    }
    const std::string memory = store.home.path("memory") + "/versions";
    fs::create_directory(store.home.path("memory"));
    {
        Client former(store, true, memory);
        former.shown();
        former.save();
    }
    store.put("People/7/b:CXPerson", "two");
    Client client(store, true, memory);
    store.asked.clear();
    const std::string shown = client.shown();
    EXPECT_NE(shown.find("/alice/Contacts/People/7/b:CXPerson b:CXPerson \"two\" 3"), std::string::npos) << shown;
    EXPECT_NE(shown.find("/alice/Contacts/People/8/a:CXPerson a:CXPerson \"one\" 3"), std::string::npos) << shown;
    EXPECT_EQ(store.asked["REPORT"], 1);
    EXPECT_EQ(store.asked["PROPFIND"], 0) << "nothing is listed";
    store.asked.clear();
    Client withoutMemory(store, true);
    EXPECT_EQ(withoutMemory.shown(), shown);
    EXPECT_GT(store.asked["PROPFIND"], 20);
}

// What is listed by changes is what the literal listing gives, whatever has happened to the tree or to the answers.
class SyncedListings : public testing::TestWithParam<unsigned> {};

TEST_P(SyncedListings, AreTheLiteralListingsAfterRandomHistories) {
    DiskStore store;
    const std::string memory = store.home.path("memory") + "/versions";
    fs::create_directory(store.home.path("memory"));
    Client literal(store, false);
    std::optional<Client> synced(std::in_place, store, true, memory);
    std::mt19937 random(GetParam());
    const auto upTo = [&](size_t n) { return std::uniform_int_distribution<size_t>(0, n - 1)(random); };
    const auto letter = [&] { return std::string(1, static_cast<char>('a' + upTo(3))); };
    const auto bucket = [&] { return "People/" + std::to_string(upTo(3)); };
    const auto person = [&] { return bucket() + "/" + letter() + ":CXPerson"; };
    const auto group = [&] { return letter() + ":CXGroup"; };
    const auto any = [&] {
        const std::function<std::string()> all[] = {bucket,
                                                    person,
                                                    group,
                                                    [&] { return group() + "/state"; },
                                                    [] { return std::string("info"); },
                                                    [] { return std::string("People"); }};
        return all[upTo(std::size(all))]();
    };
    std::error_code ignored;
    size_t reports = 0, refreshed = 0, starts = 0;
    for (int history = 0; history < 2500; ++history) {
        if (!upTo(3)) synced->save();
        if (!upTo(20)) { // with what was saved last, which may be long ago
            synced.emplace(store, true, memory);
            ++starts;
        }
        for (size_t changes = upTo(4); changes; --changes) switch (upTo(12)) {
            case 0:
            case 1:
            case 2: store.put(person(), std::to_string(upTo(5))); break;
            case 3: fs::create_directory(store.tree / bucket(), ignored); break;
            case 4: fs::create_directory(store.tree / group(), ignored); break;
            case 5: store.put(group() + "/state", std::to_string(upTo(5))); break;
            case 6: store.put(any(), std::to_string(upTo(5))); break;
            case 7: fs::remove(store.tree / person(), ignored); break;
            case 8:
                if (!upTo(4)) fs::remove_all(store.tree / any(), ignored);
                break;
            case 9: fs::rename(store.tree / any(), store.tree / any(), ignored); break;
            case 10:
                if (!upTo(10)) fs::remove_all(store.home.path("alice.sync"), ignored);
                fs::create_directory(store.tree / "People", ignored);
                break;
            default:
                if (!upTo(20)) store.refusal = upTo(2) ? 403 : 500;
                store.limit = upTo(2) ? 5000 : 1 + upTo(3);
            }
        const int before = store.asked["REPORT"], listed = store.asked["PROPFIND"];
        const std::string found = synced->shown();
        refreshed += store.asked["PROPFIND"] > listed;
        reports += store.asked["REPORT"] > before;
        ASSERT_EQ(found, literal.shown()) << "history " << history;
        ASSERT_NE(found, "nothing");
    }
    EXPECT_GT(reports, 2250u);
    EXPECT_LT(refreshed, 500u) << "most histories need no listing";
    EXPECT_GT(starts, 50u);
}

INSTANTIATE_TEST_SUITE_P(Seeds, SyncedListings, testing::Values(17u, 18u, 19u, 20u));
