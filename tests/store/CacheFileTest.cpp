#include "store/reads/CacheFile.h"

#include "RecordingTransport.h"
#include "foundation/Paths.h"
#include "store/dav/CXDAVManager.h"
#include "store/reads/GroupCopies.h"
#include "store/reads/ListingMemory.h"
#include "store/reads/VersionMemory.h"
#include "support/TempHome.h"

#include <algorithm>
#include <filesystem>
#include <gtest/gtest.h>
#include <map>
#include <rapidcheck/gtest.h>
#include <set>

using namespace rolvane;
using namespace rolvane::test;

namespace {

const Url kTree = *Url::parse("http://store.example.org/alice/Contacts");

ListingMemory::Entries entriesBelow(const Url& container, size_t count, int version) {
    ListingMemory::Entries all;
    for (size_t i = 0; i < count; ++i) {
        MultistatusEntry entry;
        entry.etag = EntityTag("\"" + std::to_string(version) + "-" + std::to_string(i) + "\"");
        if (i % 3) entry.lastModified = Date(1.7e9 + static_cast<double>(i));
        if (i % 4) entry.length = i * 1000;
        entry.isCollection = i % 5 == 4;
        all.emplace_back(container.cxURLByAppendingComponent("ü" + std::to_string(i) + ":CXPerson"), entry);
    }
    return all;
}

std::string shown(const ListingMemory& memory, const Url& container) {
    std::string out = memory.token(kTree) + "\n";
    memory.forEach(container, ListingMemory::kSynced, [&](const ListingMemory::Member& m) {
        out += std::string(m.encodedName) + " " + m.entry.etag.str() + " " +
               (m.entry.lastModified ? m.entry.lastModified->toISO8601() : "-") + " " +
               (m.entry.length ? std::to_string(*m.entry.length) : "-") + (m.entry.isCollection ? " c\n" : "\n");
    });
    return out;
}

// A store of one group, which counts what it is asked.
struct GroupStore {
    int version = 1;
    std::map<std::string, int> asked;

    std::shared_ptr<RecordingTransport> wire() {
        auto made = std::make_shared<RecordingTransport>();
        made->intercept([this](const HttpRequest& r) -> std::optional<HttpResponse> {
            ++asked[r.method];
            const std::string tag = "\"" + std::to_string(version) + "\"";
            if (r.method == "OPTIONS") return answerOf(200, {{"dav", "1,2"}});
            if (r.method == "GET")
                return answerOf(200, {{"etag", tag}},
                                "<plist version=\"1.0\"><dict><key>version</key><integer>" + std::to_string(version) +
                                    "</integer></dict></plist>");
            const std::string path = r.url.encodedPath(), tree = path.substr(0, path.find("/Contacts")) + "/Contacts";
            if (r.url.encodedPath().find("People") != std::string::npos) return answerOf(404);
            return answerOf(207, {{"date", "Tue, 14 Nov 2023 22:15:00 GMT"}},
                            "<D:multistatus xmlns:D=\"DAV:\">" + response(tree + "/", "<D:collection/>", "") +
                                response(tree + "/1:CXGroup", "", "<D:getetag>" + tag + "</D:getetag>") +
                                "</D:multistatus>");
        });
        return made;
    }
    static std::string response(const std::string& href, const std::string& type, const std::string& more) {
        return "<D:response><D:href>" + href + "</D:href><D:propstat><D:prop><D:resourcetype>" + type +
               "</D:resourcetype>" + more + "</D:prop><D:status>HTTP/1.1 200 OK</D:status></D:propstat></D:response>";
    }
};

// A daemon's client, from its start to its end.
class Process {
public:
    Process(GroupStore& store, const std::string& directory, const std::string& user = "alice")
        : _manager(account(user), store.wire(), CXDAVManager::VersionsFile{directory + "/versions"}) {
        CXDAVError error;
        EXPECT_TRUE(_manager.canReach(error)) << error.reason;
        _manager.useVersionMemoryOf("database", 1);
    }
    int64_t groupSays(const std::string& owner = "alice") {
        const CXDAVManager::Snapshot snapshot(_manager);
        const Url tree = _manager.account().baseLocationFor(UserName(owner));
        EXPECT_TRUE(_manager.infoForFilesInContainer(tree));
        const auto content = _manager.dictionaryAtURL(tree.cxURLByAppendingComponent("1:CXGroup"), nullptr, false);
        return content ? (*content)["version"].integer() : -1;
    }
    void save() { _manager.saveVersionMemory("database", 1); }
    void revert() { _manager.revertVersionMemory(); }
    void end() { _manager.processEnds(); }

private:
    static CXDAVAccount account(const std::string& user) {
        CXDAVAccount a;
        a.user = UserName(user);
        a.endpoint = "https://store.example.org/dav/{user}/Contacts";
        return a;
    }
    CXDAVManager _manager;
};

} // namespace

TEST(CacheFile, GivesBackWhatWasWrittenToItsOwnerAlone) {
    TempHome home;
    const CacheFile file(home / "memory", "alice");
    EXPECT_EQ(file.read(), "");
    file.write(std::string("a\0b", 3));
    EXPECT_EQ(file.read(), std::string("a\0b", 3));
    EXPECT_EQ(CacheFile(home / "memory", "alic").read(), "");
    EXPECT_EQ(CacheFile(home / "memory", "bobby").read(), "");
}

TEST(CacheFile, IsEmptyWhereAnyBitOfItIsDamaged) {
    TempHome home;
    const CacheFile file(home / "memory", "alice");
    file.write("content that matters");
    const std::string whole = readFile(home / "memory");
    for (size_t at = 0; at < whole.size() * 8; ++at) {
        std::string damaged = whole;
        damaged[at / 8] = static_cast<char>(damaged[at / 8] ^ (1 << at % 8));
        writeFileWhole(home / "memory", damaged);
        ASSERT_EQ(file.read(), "") << at;
    }
    for (size_t size = 0; size < whole.size(); ++size) {
        writeFileWhole(home / "memory", whole.substr(0, size));
        ASSERT_EQ(file.read(), "") << size;
    }
}

TEST(ListingMemory, IsTheSameBehindAFile) {
    const Url people = kTree.cxURLByAppendingComponent("People");
    ListingMemory memory, other, unused;
    memory.keep(people, ListingMemory::kSynced, entriesBelow(people, 50, 1));
    memory.keep(kTree, ListingMemory::kSynced, entriesBelow(kTree, 7, 1));
    memory.keepToken(kTree, "urn:token:17");
    ASSERT_TRUE(other.restore(memory.saved()));
    for (const Url& container : {kTree, people}) EXPECT_EQ(shown(other, container), shown(memory, container));
    EXPECT_NE(shown(other, people).find("urn:token:17\n"), std::string::npos);
    EXPECT_EQ(other.saved(), "") << "nobody has used the tree in this process";
    other.keepToken(kTree, "urn:token:18", ListingMemory::Files(std::in_place));
    ASSERT_TRUE(unused.restore(other.saved()));
    EXPECT_EQ(unused.token(kTree), "urn:token:18");
}

// One member after the other gives what keeping the whole anew does.
RC_GTEST_PROP(ListingMemory, EditedIsAsKeptAnew, ()) {
    const Url people = kTree.cxURLByAppendingComponent("People");
    ListingMemory::Entries entries = entriesBelow(people, 300, 1);
    ListingMemory edited, anew;
    edited.keep(people, ListingMemory::kSynced, entries);
    for (int version = 2; version < 12; ++version) {
        ListingMemory::Edits edits;
        std::map<std::string, std::string> expected, told;
        const auto tagOf = [](const std::optional<MultistatusEntry>& e) { return e ? e->etag.str() : "-"; };
        for (const size_t i : *rc::gen::container<std::set<size_t>>(8, rc::gen::inRange<size_t>(0, 400))) {
            const Url url = people.cxURLByAppendingComponent("ü" + std::to_string(i) + ":CXPerson");
            const std::string name = url.absoluteString().substr(url.absoluteString().rfind('/') + 1);
            std::optional<MultistatusEntry> now;
            if (*rc::gen::inRange(0, 4) != 0) {
                now.emplace();
                now->etag = EntityTag(std::string(*rc::gen::inRange<size_t>(1, 9), 't') + std::to_string(version));
                now->length = i;
            }
            edits[name] = now;
            const auto held = std::find_if(entries.begin(), entries.end(), [&](const auto& each) {
                return each.first.absoluteString() == url.absoluteString();
            });
            expected[name] = (held == entries.end() ? "-" : held->second.etag.str()) + " " + tagOf(now);
            if (held != entries.end() && now) held->second = *now;
            if (held != entries.end() && !now) entries.erase(held);
        }
        for (const auto& [name, now] : edits) { // new ones come last, by name
            const Url url(people.absoluteString() + "/" + name);
            const bool isHeld = std::any_of(entries.begin(), entries.end(), [&](const auto& each) {
                return each.first.absoluteString() == url.absoluteString();
            });
            if (now && !isHeld) entries.emplace_back(url, *now);
        }
        RC_ASSERT(edited.edit(people, ListingMemory::kSynced, edits,
                              [&](const auto& name, const auto& before, const auto& now) {
                                  told[name] = tagOf(before) + " " + tagOf(now);
                              }));
        RC_ASSERT(told == expected);
        anew.keep(people, ListingMemory::kSynced, entries);
        RC_ASSERT(shown(edited, people) == shown(anew, people));
        for (const auto& [name, now] : edits)
            RC_ASSERT(tagOf(edited.member(people, ListingMemory::kSynced, name)) == tagOf(now));
    }
    RC_ASSERT(!edited.edit(kTree, ListingMemory::kSynced, {}, {}));
}

TEST(ListingMemory, TellsTheFilesThatHaveChangedSinceAState) {
    ListingMemory memory;
    using Files = std::vector<std::string>;
    memory.keepToken(kTree, "1");
    const uint64_t first = memory.stateOf(kTree);
    EXPECT_EQ(memory.filesChangedSince(kTree, first), Files());
    memory.keepToken(kTree, "2", Files());
    EXPECT_EQ(memory.stateOf(kTree), first) << "the clock file alone";
    memory.keepToken(kTree, "3", Files{"a", "b"});
    const uint64_t second = memory.stateOf(kTree);
    EXPECT_NE(second, first);
    memory.keepToken(kTree, "4", Files{"c"});
    EXPECT_EQ(memory.filesChangedSince(kTree, first), (Files{"a", "b", "c"}));
    EXPECT_EQ(memory.filesChangedSince(kTree, second), Files{"c"});
    EXPECT_EQ(memory.filesChangedSince(kTree, first - 1), std::nullopt) << "before the tree was listed";
    memory.keepToken(kTree, "5", std::nullopt); // a group, or somebody new
    EXPECT_EQ(memory.filesChangedSince(kTree, second), std::nullopt);
    const uint64_t third = memory.stateOf(kTree);
    for (int i = 0; i < 300; ++i) memory.keepToken(kTree, "6", Files{std::to_string(i)});
    EXPECT_EQ(memory.filesChangedSince(kTree, third), std::nullopt) << "too many";
    ASSERT_TRUE(memory.filesChangedSince(kTree, memory.stateOf(kTree) - 1));
    const uint64_t last = memory.stateOf(kTree);
    memory.forgetBelow(kTree);
    EXPECT_EQ(memory.filesChangedSince(kTree, last), std::nullopt);
    memory.keepToken(kTree, "7", Files{"d"});
    EXPECT_EQ(memory.filesChangedSince(kTree, last), std::nullopt) << "listed anew";
}

TEST(VersionMemory, NamesTheLastURLsOfWhichSomethingHasBecomeKnown) {
    VersionMemory memory({}, 1000);
    const auto read = [&](const std::string& url, int version) {
        memory.read(url, {EntityTag("\"" + std::to_string(version) + "\""), std::nullopt, 1});
    };
    using Names = std::vector<std::string>;
    memory.belongTo({1, 1});
    read("a", 1);
    const uint64_t first = memory.changes();
    read("a", 1);
    read("x/dateFile", 1);
    EXPECT_EQ(memory.changedSince(first), Names()) << "nothing new, and a clock file";
    read("b", 1);
    memory.forget("a");
    memory.wrote("c", EntityTag("\"1\""), std::nullopt, "content");
    EXPECT_EQ(memory.changedSince(first), (Names{"b", "a", "c"}));
    EXPECT_EQ(memory.changedSince(memory.changes()), Names());
    for (int i = 0; i < 400; ++i) read("d" + std::to_string(i), 1);
    EXPECT_EQ(memory.changedSince(first), std::nullopt) << "too many";
    EXPECT_EQ(memory.changedSince(memory.changes() - 1), Names{"d399"});
    const uint64_t before = memory.changes();
    memory.revert();
    EXPECT_EQ(memory.changedSince(before), std::nullopt) << "nobody knows which";
    VersionMemory small({}, 2);
    const uint64_t none = small.changes();
    for (const char* url : {"a", "b", "c"}) small.read(url, {EntityTag("\"1\""), std::nullopt, 1});
    EXPECT_EQ(small.changedSince(none), std::nullopt) << "one has gone for want of room";
}

RC_GTEST_PROP(ListingMemory, TakesNothingOverFromADamagedText, ()) {
    const Url people = kTree.cxURLByAppendingComponent("People");
    ListingMemory memory;
    memory.keep(people, ListingMemory::kSynced, entriesBelow(people, *rc::gen::inRange<size_t>(0, 9), 1));
    memory.keepToken(kTree, "token");
    std::string text = memory.saved();
    const auto at = *rc::gen::inRange<size_t>(0, text.size());
    if (*rc::gen::arbitrary<bool>())
        text.resize(at);
    else
        text[at] = *rc::gen::arbitrary<char>();
    ListingMemory other;
    if (other.restore(text)) // whatever it says, all of it can be read
        shown(other, people);
    else
        RC_ASSERT(other.token(kTree).empty());
}

TEST(ListingMemory, IsWorthSavingWithANewTreeAndThenWithATenthOfChanges) {
    const Url people = kTree.cxURLByAppendingComponent("People");
    ListingMemory memory;
    EXPECT_FALSE(memory.isWorthSaving(true));
    memory.keep(people, ListingMemory::kSynced, entriesBelow(people, 5000, 1));
    memory.keepToken(kTree, "1");
    EXPECT_TRUE(memory.isWorthSaving(false));
    memory.wasSaved();
    memory.keepToken(kTree, "2");
    memory.noteChanges(499);
    EXPECT_FALSE(memory.isWorthSaving(false)) << "an edit does not write a listing";
    EXPECT_TRUE(memory.isWorthSaving(true));
    memory.noteChanges(2);
    EXPECT_TRUE(memory.isWorthSaving(false));
}

TEST(ListingMemory, IsWorthSavingAtTheEndWhileItHasATreeThatNobodyAsksForAnyMore) {
    const Url other = *Url::parse("http://store.example.org/carol/Contacts");
    ListingMemory memory;
    for (const Url& tree : {kTree, other}) {
        memory.keep(tree, ListingMemory::kSynced, entriesBelow(tree, 3, 1));
        memory.keepToken(tree, "1");
    }
    ListingMemory next;
    ASSERT_TRUE(next.restore(memory.saved()));
    EXPECT_FALSE(next.isWorthSaving(true)) << "nothing was asked";
    next.keepToken(kTree, "1", std::vector<std::string>());
    EXPECT_FALSE(next.isWorthSaving(false));
    EXPECT_TRUE(next.isWorthSaving(true));
    ListingMemory last;
    ASSERT_TRUE(last.restore(next.saved()));
    EXPECT_EQ(last.token(kTree), "1");
    EXPECT_EQ(last.token(other), "");
}

TEST(GroupCopies, OfAProcessThatHasEndedAreNotReadAgain) {
    TempHome home;
    GroupStore store;
    {
        Process first(store, home.path());
        EXPECT_EQ(first.groupSays(), 1);
        first.save();
        first.end();
    }
    EXPECT_EQ(store.asked["GET"], 1);
    {
        Process second(store, home.path());
        EXPECT_EQ(second.groupSays(), 1);
        EXPECT_EQ(store.asked["GET"], 1);
    }
    Process stranger(store, home.path(), "bob");
    EXPECT_EQ(stranger.groupSays(), 1);
    EXPECT_EQ(store.asked["GET"], 2) << "another account reads for itself";
}

TEST(GroupCopies, OfATreeThatIsNotReadAnyMoreLeaveTheFile) {
    TempHome home;
    GroupStore store;
    const auto isInTheFile = [&](const char* owner) {
        return readFile(home.path() + "/groups").find(std::string("/") + owner + "/Contacts/") != std::string::npos;
    };
    {
        Process first(store, home.path());
        EXPECT_EQ(first.groupSays("alice"), 1);
        EXPECT_EQ(first.groupSays("carol"), 1);
        first.save();
        first.end();
    }
    EXPECT_TRUE(isInTheFile("alice"));
    EXPECT_TRUE(isInTheFile("carol"));
    {
        Process away(store, home.path()); // and has looked at nothing
        away.end();
    }
    EXPECT_TRUE(isInTheFile("carol"));
    Process second(store, home.path());
    EXPECT_EQ(second.groupSays("alice"), 1);
    second.end();
    EXPECT_TRUE(isInTheFile("alice"));
    EXPECT_FALSE(isInTheFile("carol"));
    EXPECT_EQ(store.asked["GET"], 2);
}

TEST(GroupCopies, OfAnotherVersionAreReadAgain) {
    TempHome home;
    GroupStore store;
    {
        Process first(store, home.path());
        EXPECT_EQ(first.groupSays(), 1);
        first.save();
        first.end();
    }
    store.version = 2;
    {
        Process second(store, home.path());
        EXPECT_EQ(second.groupSays(), 2);
        second.end();
    } // without a save: its version counts as not read
    Process third(store, home.path());
    EXPECT_EQ(third.groupSays(), 2);
    EXPECT_EQ(store.asked["GET"], 3);
}

// The versions are those of before the failed pass, and what it read was another one.
TEST(GroupCopies, OfAPassThatCouldNotBeStoredAreNotKept) {
    TempHome home;
    GroupStore store;
    {
        Process first(store, home.path());
        EXPECT_EQ(first.groupSays(), 1);
        first.save();
        store.version = 2;
        EXPECT_EQ(first.groupSays(), 2);
        first.revert();
        first.end();
    }
    store.version = 1; // the store was set back
    Process second(store, home.path());
    EXPECT_EQ(second.groupSays(), 1);
}
