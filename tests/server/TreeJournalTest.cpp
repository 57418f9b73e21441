#include "server/mod_davacl/TreeJournal.h"

#include "StoreTestWorld.h"

#include <chrono>
#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <map>
#include <random>
#include <set>
#include <sys/stat.h>

namespace rolvane {
namespace {

using davacl::SyncToken;
using davacl::TreeJournal;
using testing::ElementsAre;
using testing::IsEmpty;
namespace fs = std::filesystem;
using Outcome = TreeJournal::Outcome;

int64_t now() {
    using namespace std::chrono;
    return duration_cast<nanoseconds>(system_clock::now().time_since_epoch()).count();
}

// Somebody who keeps a copy of what a tree holds by its journal alone.
struct Follower {
    bool isDeep = true;
    std::map<std::string, std::string> members = {}; // content of files by path; "/" of collections
    std::optional<SyncToken> token = {};
    size_t told = 0; // by the last answer
};

class Journal : public testing::Test {
protected:
    Journal() { fs::create_directories(tree); }
    void write(const std::string& name, const std::string& text) const { std::ofstream(tree / name) << text; }

    TreeJournal::Question question(bool isDeep, const std::optional<SyncToken>& from, size_t limit = 1000000) const {
        TreeJournal::Question q;
        q.path = tree;
        q.below = {"Contacts"};
        q.isDeep = isDeep;
        q.scope = 7;
        q.shows = [this](const std::vector<std::string>& below) { return !hidden.contains(below.back()); };
        q.from = from;
        q.limit = limit;
        q.now = now() + later;
        q.settle = settle;
        return q;
    }
    TreeJournal::Answer ask(bool isDeep, const std::optional<SyncToken>& from, size_t limit = 1000000) const {
        return TreeJournal(journal).changes(question(isDeep, from, limit));
    }
    std::vector<std::string> changed(const std::optional<SyncToken>& from) const {
        std::vector<std::string> out;
        for (const auto& change : ask(true, from).changes) out.push_back((change.isGone ? "-" : "+") + change.path);
        std::sort(out.begin(), out.end());
        return out;
    }

    std::string contentOf(const std::string& path) const {
        if (fs::is_directory(tree / path)) return "/";
        std::ifstream file(tree / path);
        return {std::istreambuf_iterator<char>(file), {}};
    }
    std::map<std::string, std::string> everything(bool isDeep) const {
        std::map<std::string, std::string> out;
        for (auto at = fs::recursive_directory_iterator(tree); at != fs::recursive_directory_iterator(); ++at) {
            if (!isDeep) at.disable_recursion_pending();
            const std::string path = at->path().lexically_relative(tree);
            if (hidden.contains(at->path().filename())) {
                at.disable_recursion_pending();
                continue;
            }
            out[path] = contentOf(path);
        }
        return out;
    }
    // In pages of `limit`; from the beginning where the token is no longer good.
    void follow(Follower& f, size_t limit = 1000000) const {
        f.told = 0;
        for (bool goesOn = true; goesOn;) {
            const auto answer = ask(f.isDeep, f.token, limit);
            if (answer.outcome == Outcome::invalidToken) {
                f.members.clear();
                f.token.reset();
                continue;
            }
            ASSERT_EQ(answer.outcome, Outcome::told) << answer.error;
            ASSERT_LE(answer.changes.size(), limit);
            for (const auto& change : answer.changes) {
                ++f.told;
                // What is gone takes what was below it along; what has become a file, too.
                const std::string below = change.path + "/";
                if (change.isGone || !change.isCollection)
                    f.members.erase(f.members.lower_bound(below), f.members.lower_bound(change.path + "0"));
                if (change.isGone)
                    f.members.erase(change.path);
                else
                    f.members[change.path] = contentOf(change.path);
            }
            goesOn = answer.token.cut.has_value();
            f.token = SyncToken::parse(answer.token.text());
            ASSERT_TRUE(f.token);
        }
    }

    StoreDirectory home;
    const fs::path tree = home.path("tree");
    const std::string journal = home.path("alice.sync");
    std::set<std::string> hidden;
    int64_t settle = TreeJournal::kSettle;
    int64_t later = 0; // nanoseconds that the clock of the looks is ahead
};

constexpr int64_t kHour = int64_t{3600} * 1000000000;

} // namespace

TEST_F(Journal, TellsWhatHasChanged) {
    later = kHour;
    fs::create_directories(tree / "People/1");
    write("People/1/a", "one");
    write("info", "x");
    const auto first = ask(true, {});
    ASSERT_EQ(first.outcome, Outcome::told);
    EXPECT_EQ(first.changes.size(), 4u);
    EXPECT_THAT(changed(first.token), IsEmpty());
    EXPECT_EQ(ask(true, first.token).token.text(), first.token.text()) << "nothing new is the same token";
    write("People/1/b", "two");
    write("info", "y");
    const auto second = ask(true, first.token);
    EXPECT_THAT(changed(first.token), ElementsAre("+People/1", "+People/1/b", "+info"));
    EXPECT_THAT(changed(second.token), IsEmpty());
    fs::remove(tree / "People/1/a");
    EXPECT_THAT(changed(second.token), ElementsAre("+People/1", "-People/1/a"));
    fs::remove_all(tree / "People");
    EXPECT_THAT(changed(second.token), ElementsAre("-People"));
    EXPECT_THAT(changed(first.token), ElementsAre("+info", "-People"));
}

// httpd leaves what it is receiving in a file beside.
TEST_F(Journal, TellsNothingOfBooksAndPipesAndUploads) {
    fs::create_directories(tree / ".DAV");
    write(".davfs.tmp0123ab", "half");
    ASSERT_EQ(mkfifo((tree / "pipe").c_str(), 0600), 0);
    EXPECT_THAT(ask(true, {}).changes, IsEmpty());
}

TEST_F(Journal, TellsAgainWhatMayHaveChangedWithinOneStepOfTheClock) {
    write("a", "one");
    const auto first = ask(true, {});
    EXPECT_THAT(changed(first.token), ElementsAre("+a")) << "it is younger than the clock's steps may be";
    later = kHour;
    const auto second = ask(true, first.token);
    EXPECT_EQ(second.changes.size(), 1u) << "and may have changed behind the look";
    EXPECT_THAT(changed(second.token), IsEmpty());
}

TEST_F(Journal, ACollectionThatComesBackComesWithEverythingInIt) {
    later = kHour;
    fs::create_directories(tree / "A/B");
    write("A/B/x", "one");
    const auto first = ask(true, {});
    fs::rename(tree / "A", home.path("away"));
    const auto gone = ask(true, first.token);
    ASSERT_EQ(gone.changes.size(), 1u);
    fs::rename(home.path("away"), tree / "A");
    EXPECT_THAT(changed(gone.token), ElementsAre("+A", "+A/B", "+A/B/x")) << "though their dates are the same";
    EXPECT_THAT(changed(ask(true, gone.token).token), IsEmpty());
}

TEST_F(Journal, ATokenIsGoodForItsJournalItsPlaceAndItsDepth) {
    write("a", "one");
    const SyncToken deep = ask(true, {}).token, flat = ask(false, {}).token;
    EXPECT_EQ(ask(false, deep).outcome, Outcome::told);
    EXPECT_EQ(ask(true, flat).outcome, Outcome::invalidToken);
    auto q = question(true, deep);
    q.scope = 8;
    EXPECT_EQ(TreeJournal(journal).changes(q).outcome, Outcome::invalidToken);
    fs::remove_all(journal);
    EXPECT_EQ(ask(true, deep).outcome, Outcome::invalidToken);
    for (const char* text : {"", "urn:x-rolvane:tree:", "urn:x-rolvane:tree:d", "urn:x-rolvane:tree:d:1:2:3",
                             "urn:x-rolvane:tree:d:1:2:3:4:5", "urn:x-rolvane:tree:d:1:2:3:g",
                             "urn:x-rolvane:tree:x:1:2:3:4", "urn:x-rolvane:tree:d:1:2:3:4:",
                             "urn:x-rolvane:tree:d:1:2:3:11111111111111111", "urn:x-rolvane:tree:d:1:2:3:4:5:6:7:8:9"})
        EXPECT_FALSE(SyncToken::parse(text)) << text;
}

// A note that is gone or spoilt cannot tell who has departed.
TEST_F(Journal, LostNotesMakeOlderTokensInvalid) {
    later = kHour;
    fs::create_directories(tree / "A");
    write("A/x", "one");
    write("A/y", "one");
    const auto spoil = [&](const std::function<void(const fs::path&)>& harm, const std::string& name) {
        const SyncToken token = ask(true, {}).token;
        ASSERT_EQ(ask(true, token).outcome, Outcome::told);
        std::vector<fs::path> files;
        for (const auto& entry : fs::recursive_directory_iterator(journal))
            if (entry.path().filename() == name) files.push_back(entry.path());
        ASSERT_FALSE(files.empty());
        for (const auto& file : files) {
            const SyncToken before = ask(true, {}).token;
            harm(file);
            write("A/z", file);
            EXPECT_EQ(ask(true, before).outcome, Outcome::invalidToken) << file;
            Follower f;
            follow(f);
            EXPECT_EQ(f.members, everything(true));
        }
    };
    for (const char* name : {"index", "head"}) {
        spoil([](const fs::path& file) { fs::remove(file); }, name);
        spoil([](const fs::path& file) { fs::resize_file(file, fs::file_size(file) / 2); }, name);
        spoil([](const fs::path& file) { std::fstream(file) << "spoilt"; }, name);
        spoil([](const fs::path& file) { fs::resize_file(file, 0); }, name);
    }
}

// Somebody has put an older copy of the store in its place, notes and all.
TEST_F(Journal, NotesThatWereSetBackMakeLaterTokensInvalid) {
    later = kHour;
    write("a", "one");
    const SyncToken former = ask(true, {}).token;
    const std::string copy = home.path("copy");
    fs::copy(journal, copy, fs::copy_options::recursive);
    write("b", "two");
    const SyncToken after = ask(true, former).token;
    ASSERT_GT(after.number, former.number);
    fs::remove_all(journal);
    fs::rename(copy, journal);
    fs::remove(tree / "b");
    EXPECT_EQ(ask(true, after).outcome, Outcome::invalidToken);
    EXPECT_EQ(ask(true, former).outcome, Outcome::told);
}

TEST_F(Journal, ManyDeparturesAreForgotten) {
    later = kHour;
    write("stays", "one");
    const SyncToken old = ask(true, {}).token;
    SyncToken last = old;
    for (size_t round = 0; round < 2; ++round) {
        for (size_t i = 0; i < TreeJournal::kMostDepartures; ++i)
            write(std::to_string(round) + "-" + std::to_string(i), "one");
        ask(true, {});
        for (size_t i = 0; i < TreeJournal::kMostDepartures; ++i)
            fs::remove(tree / (std::to_string(round) + "-" + std::to_string(i)));
        if (round == 0) last = ask(true, {}).token;
    }
    EXPECT_EQ(ask(true, old).outcome, Outcome::invalidToken);
    EXPECT_LE(ask(true, {}).changes.size(), 1u);
    EXPECT_EQ(ask(true, last).outcome, Outcome::told) << "what is new enough is known";
}

TEST_F(Journal, SaysWhereItCannotNote) {
    write("a", "one");
    std::ofstream(journal) << "in the way";
    const auto answer = ask(true, {});
    EXPECT_EQ(answer.outcome, Outcome::unwritable);
    EXPECT_NE(answer.error, 0);
    fs::remove(journal);
    fs::create_directories(tree / "A");
    fs::create_symlink(home.path(), tree / "link");
    EXPECT_EQ(ask(true, {}).outcome, Outcome::linked);
    EXPECT_EQ(ask(false, {}).outcome, Outcome::told);
    fs::remove_all(tree);
    EXPECT_EQ(ask(true, {}).outcome, Outcome::unreadable);
}

// Whatever happens to a tree, by whichever way, followers of every kind have what is there after each of their looks.
TEST_F(Journal, FollowersHaveWhatIsThereAfterRandomHistories) {
    settle = 50000000; // a file system's clock is exact to ten milliseconds
    std::mt19937 random(20261122);
    const auto upTo = [&](size_t n) { return std::uniform_int_distribution<size_t>(0, n - 1)(random); };
    const auto place = [&] {
        std::string path;
        for (size_t depth = upTo(3); depth; --depth) path += std::string(1, static_cast<char>('A' + upTo(3))) + "/";
        return path + std::string(1, static_cast<char>((upTo(3) ? 'a' : 'A') + upTo(3)));
    };
    Follower followers[] = {{true}, {true}, {true}, {false}, {false}};
    std::error_code ignored;
    size_t incremental = 0;
    for (int step = 0; step < 10000; ++step) {
        const std::string at = place(), to = place();
        switch (upTo(9)) {
        case 0:
        case 1:
        case 2: // as httpd does
            if (!fs::is_directory(tree / at, ignored)) {
                std::ofstream(home.path("upload")) << upTo(10);
                fs::rename(home.path("upload"), tree / at, ignored);
            }
            break;
        case 3:
            if (!fs::is_directory(tree / at, ignored)) std::ofstream(tree / at) << upTo(10); // in place
            break;
        case 4: fs::create_directory(tree / at, ignored); break;
        case 5: fs::remove_all(tree / at, ignored); break;
        case 6: fs::rename(tree / at, tree / to, ignored); break;
        case 7:
            if (!to.starts_with(at + "/")) fs::copy(tree / at, tree / to, fs::copy_options::recursive, ignored);
            break;
        default: break;
        }
        if (everything(true).size() > 60) fs::remove_all(tree / std::string(1, static_cast<char>('A' + upTo(3))));
        if (step % 500 == 499) hidden = upTo(2) ? std::set<std::string>{} : std::set<std::string>{"B"};
        if (step % 500 == 499)
            for (Follower& f : followers) f = {f.isDeep}; // rights are in the scope of a token, so it begins anew
        Follower& f = followers[upTo(std::size(followers))];
        const bool hadToken = f.token.has_value();
        ASSERT_NO_FATAL_FAILURE(follow(f, upTo(2) ? 1000000 : 1 + upTo(4)));
        ASSERT_EQ(f.members, everything(f.isDeep)) << "step " << step;
        incremental += hadToken && f.told < f.members.size();
    }
    EXPECT_GT(incremental, 1000u) << "most looks tell a part";
}

} // namespace rolvane
