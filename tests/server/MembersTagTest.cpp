#include "server/mod_davacl/MembersTag.h"

#include "AccessWorld.h"

#include <chrono>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <functional>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <thread>

namespace rolvane {
namespace {

using davacl::membersTag;
using testing::HasSubstr;
using testing::Not;
namespace fs = std::filesystem;

int64_t now() {
    using namespace std::chrono;
    return duration_cast<nanoseconds>(system_clock::now().time_since_epoch()).count();
}

struct Directory {
    Directory() {
        fs::create_directories(path);
        for (const char* name : {"a", "b", "c"}) write(name, "one");
    }
    void write(const std::string& name, const std::string& text) const { std::ofstream(path / name) << text; }
    std::optional<std::string> tag(double secondsLater = 3600) const {
        return membersTag(path, now() + static_cast<int64_t>(secondsLater * 1e9));
    }
    StoreDirectory home;
    const fs::path path = home.path("members");
};

} // namespace

TEST(MembersTag, IsAnotherOneAfterEveryChange) {
    const Directory directory;
    const std::pair<const char*, std::function<void()>> changes[] = {
        {"added", [&] { directory.write("d", "one"); }},
        {"removed", [&] { fs::remove(directory.path / "d"); }},
        {"written in place, with the same size", [&] { directory.write("a", "two"); }},
        {"grown", [&] { std::ofstream(directory.path / "a", std::ios::app) << "more"; }},
        {"renamed", [&] { fs::rename(directory.path / "b", directory.path / "e"); }},
        {"swapped",
         [&] {
             fs::rename(directory.path / "a", directory.path / "x");
             fs::rename(directory.path / "c", directory.path / "a");
             fs::rename(directory.path / "x", directory.path / "c");
         }},
        {"put back with its old date",
         [&] {
             const auto date = fs::last_write_time(directory.path / "a");
             directory.write("a", "six");
             fs::last_write_time(directory.path / "a", date);
         }},
        {"a member that is a directory", [&] { fs::create_directory(directory.path / "f"); }},
        {"a link that leads nowhere", [&] { fs::create_symlink("nowhere", directory.path / "g"); }}};
    auto before = directory.tag();
    ASSERT_TRUE(before);
    for (const auto& [what, change] : changes) {
        EXPECT_EQ(directory.tag(), before) << "before: " << what;
        // Changes within one step of the file system's clock are what the settling is for.
        const auto step = [&] {
            change();
            for (const timespec start =
                     [&] {
                         struct stat s {};
                         stat((directory.path / ".").c_str(), &s);
                         return s.st_mtim;
                     }();
                 ;) {
                std::ofstream(directory.path.parent_path() / "clock") << "tick";
                struct stat s {};
                stat((directory.path.parent_path() / "clock").c_str(), &s);
                if (s.st_mtim.tv_sec != start.tv_sec || s.st_mtim.tv_nsec != start.tv_nsec) return;
            }
        };
        step();
        const auto after = directory.tag();
        ASSERT_TRUE(after) << what;
        EXPECT_NE(after, before) << what;
        before = after;
    }
}

TEST(MembersTag, ToldOfALinkFollowsWhatItLeadsTo) {
    const Directory directory;
    const fs::path target = directory.path.parent_path() / "target";
    std::ofstream(target) << "one";
    fs::create_symlink(target, directory.path / "link");
    const auto before = directory.tag();
    std::ofstream(target) << "longer";
    EXPECT_NE(directory.tag(), before);
}

TEST(MembersTag, IsNotToldWhileAMemberIsYoungOrFromTheFuture) {
    const Directory directory;
    EXPECT_FALSE(directory.tag(0));
    EXPECT_FALSE(directory.tag(davacl::kSettleSeconds - 0.5));
    EXPECT_TRUE(directory.tag(davacl::kSettleSeconds + 0.5));
    EXPECT_FALSE(directory.tag(-10)) << "the clock went back";
}

TEST(MembersTag, LeavesTheBooksOfTheServerOut) {
    const Directory directory;
    fs::create_directory(directory.path / ".DAV");
    const auto before = directory.tag();
    std::ofstream(directory.path / ".DAV" / "a") << "a property";
    EXPECT_EQ(directory.tag(), before);
}

TEST(MembersTag, IsNothingOfWhatIsNoDirectory) {
    const Directory directory;
    EXPECT_FALSE(membersTag(directory.path / "a", now()));
    EXPECT_FALSE(membersTag(directory.path / "nothing", now()));
}

namespace {

// The property as a user is told it; empty: not told.
std::string told(const AccessWorld& world, const std::string& user, const std::string& path,
                 const std::string& depth = "0") {
    const std::string body = "<propfind xmlns=\"DAV:\"><prop><members-tag xmlns=\"http://rolvane.net/ns/\"/></prop>"
                             "</propfind>";
    const RawAnswer answer = world.ask(user, "PROPFIND", path, {{"Depth", depth}}, body);
    const size_t ok = answer.body.find("<R:members-tag xmlns:R=\"http://rolvane.net/ns/\">");
    const size_t end = answer.body.find("</R:members-tag>");
    if (answer.status != 207 || ok == std::string::npos || end == std::string::npos) return {};
    const size_t start = answer.body.find('>', ok) + 1;
    return answer.body.substr(start, end - start);
}

} // namespace

TEST(MembersTag, IsAPropertyOfCollectionsForWhomMayReadThem) {
    const AccessWorld world;
    world.reset();
    const std::string tree = "/dav/alice/Contacts/";
    EXPECT_THAT(world.ask("rita", "OPTIONS", tree).headers, HasSubstr("<http://rolvane.net/ns/members-tag>"));
    EXPECT_EQ(told(world, "rita", tree), "") << "just made";
    const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    while (told(world, "rita", tree).empty() && std::chrono::steady_clock::now() < end)
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    const std::string settled = told(world, "rita", tree);
    EXPECT_NE(settled, "");
    EXPECT_EQ(told(world, "alice", tree), settled);
    EXPECT_EQ(told(world, "sam", tree), "") << "may not read";
    EXPECT_EQ(told(world, "rita", tree + "dateFile"), "") << "no collection";
    EXPECT_EQ(told(world, "alice", "/dav/alice/", "1").empty(), false) << "of members of a listing, too";
    const RawAnswer all =
        world.ask("rita", "PROPFIND", tree, {{"Depth", "0"}}, "<propfind xmlns=\"DAV:\"><allprop/></propfind>");
    EXPECT_THAT(all.body, Not(HasSubstr("members-tag"))) << "costs, so it is told when it is asked for";
    const std::string patch = "<propertyupdate xmlns=\"DAV:\"><set><prop><m:members-tag "
                              "xmlns:m=\"http://rolvane.net/ns/\">mine</m:members-tag></prop></set></propertyupdate>";
    EXPECT_THAT(world.ask("alice", "PROPPATCH", tree, {}, patch).body, HasSubstr("cannot-modify-protected-property"));
    EXPECT_EQ(told(world, "rita", tree), settled) << "nobody sets it";
    EXPECT_EQ(world.status("alice", "PUT", tree + "new", {}, "x"), 201);
    EXPECT_EQ(told(world, "rita", tree), "") << "changed just now";
}

TEST(MembersTag, IsNotAnnouncedByAStoreThatDoesNotGiveIt) {
    PrivateStoreOptions options;
    options.accessLists = false;
    const AccessWorld world(options);
    EXPECT_THAT(world.ask("alice", "OPTIONS", "/dav/alice/").headers, Not(HasSubstr("members-tag")));
}

} // namespace rolvane
