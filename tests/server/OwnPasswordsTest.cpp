#include "server/mod_davacl/OwnPasswords.h"

#include "AccessWorld.h"
#include "foundation/Paths.h"

#include <filesystem>
#include <future>
#include <gtest/gtest.h>
#include <sys/stat.h>

namespace rolvane {
namespace {

using davacl::OwnPasswords;
using Written = OwnPasswords::Written;

TEST(OwnPasswordFiles, AChoiceStandsForTheHashThatItWasMadeOver) {
    const StoreDirectory directory;
    const OwnPasswords own(directory.path());
    EXPECT_EQ(own.inForce("alice", "given"), "given");
    EXPECT_EQ(own.choose("alice", "given", "given", "chosen"), Written::done);
    EXPECT_EQ(own.inForce("alice", "given"), "chosen");
    EXPECT_EQ(own.inForce("alice", "given anew"), "given anew") << "the administrator's word counts again";
    EXPECT_EQ(own.inForce("bob", "given"), "given");
    EXPECT_EQ(own.choose("alice", "given", "given", "third"), Written::otherMeanwhile);
    EXPECT_EQ(own.inForce("alice", "given"), "chosen");
    EXPECT_EQ(own.choose("alice", "given", "chosen", "third"), Written::done);
    EXPECT_EQ(own.inForce("alice", "given"), "third");
}

TEST(OwnPasswordFiles, NamesLeadNowhereElse) {
    const StoreDirectory directory;
    std::filesystem::create_directory(directory.path("own"));
    const OwnPasswords own(directory.path("own"));
    for (const char* user : {"../up", ".", "..", ".lock", "a/b"}) {
        EXPECT_EQ(own.choose(user, "given", "given", "chosen"), Written::done) << user;
        EXPECT_EQ(own.inForce(user, "given"), "chosen") << user;
    }
    for (const auto& entry : std::filesystem::directory_iterator(directory.path()))
        EXPECT_EQ(entry.path().filename(), "own");
}

TEST(OwnPasswordFiles, WhatIsDamagedOrALinkCountsForNothing) {
    const StoreDirectory directory;
    const OwnPasswords own(directory.path());
    const std::string path = directory.path("alice.password");
    ASSERT_EQ(own.choose("alice", "given", "given", "chosen"), Written::done);
    const std::string whole = readFile(path);
    for (size_t size = 0; size < whole.size(); ++size) {
        writeFileDurably(path, whole.substr(0, size), 0600);
        EXPECT_EQ(own.inForce("alice", "given"), "given") << size;
    }
    writeFileDurably(directory.path("elsewhere"), whole, 0600);
    std::filesystem::remove(path);
    std::filesystem::create_symlink(directory.path("elsewhere"), path);
    EXPECT_EQ(own.inForce("alice", "given"), "given");
    EXPECT_EQ(OwnPasswords(directory.path("nowhere")).choose("alice", "g", "g", "c"), Written::failed);
}

class OwnPassword : public testing::Test {
protected:
    static constexpr const char* kType = "application/x-rolvane-password";
    // 0 where the user keeps a password that the test does not know any more.
    int change(const std::string& user, const std::string& whose, const std::string& password,
               const std::string& type = kType) {
        return world.status(user, "POST", "/principals/users/" + whose, {{"Content-Type", type}}, password);
    }
    bool signsIn(const std::string& user) {
        return world.status(user, "PROPFIND", "/principals/", {{"Depth", "0"}}) == 207;
    }
    AccessWorld world;
};

TEST_F(OwnPassword, CountsFromTheAnswerOnAndTheFormerOneNoMore) {
    world.reset();
    const std::string given = readFile(world.store.stateDirectory() + "/conf/passwords");
    ASSERT_TRUE(signsIn("rita"));
    EXPECT_EQ(change("rita", "rita", "another long word"), 204);
    EXPECT_FALSE(signsIn("rita")) << "whoever has the former one";
    EXPECT_TRUE(signsIn("sam"));
    EXPECT_EQ(readFile(world.store.stateDirectory() + "/conf/passwords"), given) << "the owner's file is not touched";
    const CurlClient curl(world.store, "rita", "another long word");
    EXPECT_EQ(curl.request("PROPFIND", "/alice/Contacts/", {"Depth: 0"}).status, 207);
    struct stat info {};
    ASSERT_EQ(stat((world.store.stateDirectory() + "/own/rita.password").c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 0777U, 0600U);
    // The owner of the store has the last word.
    world.store.addUser("rita", rawPasswordOf("rita"));
    EXPECT_TRUE(signsIn("rita"));
    EXPECT_EQ(curl.request("PROPFIND", "/alice/Contacts/", {"Depth: 0"}).status, 401);
}

TEST_F(OwnPassword, IsChangedByNobodyElse) {
    EXPECT_EQ(change("sam", "alice", "another long word"), 405);
    EXPECT_EQ(change("", "alice", "another long word"), 401);
    EXPECT_EQ(change("sam", "nobody", "another long word"), 404);
    for (const char* user : {"alice", "sam"}) EXPECT_TRUE(signsIn(user)) << user;
}

// However the name of somebody else is written.
TEST_F(OwnPassword, OfSomebodyElseIsReachedByNoSpelling) {
    for (const char* path : {"/principals/users/%61lice",
                             "/principals/users/sam/../alice",
                             "/principals/users/sam%2f..%2falice",
                             "//principals//users//alice",
                             "/principals/users/alice/",
                             "/principals/users/alice/sam",
                             "/principals/users/alice;sam",
                             "/principals/users/alice?sam",
                             "/principals/./users/alice",
                             "/principals/groups/../users/alice",
                             "/dav/../principals/users/alice",
                             "/principals/users/Alice",
                             "/principals/users/alice%00sam",
                             "/principals/users/../users/alice",
                             "http://localhost/principals/users/alice",
                             "/principals/users/",
                             "/principals/users",
                             "/principals/",
                             "/dav/alice",
                             "/dav/sam"}) {
        const int status = world.status(
            "sam", "POST", path, {{"Content-Type", kType}, {"X-HTTP-Method-Override", "PUT"}}, "another long word");
        EXPECT_TRUE(status >= 400 && status < 500) << status << " for " << path;
    }
    for (const char* user : {"alice", "sam"}) EXPECT_TRUE(signsIn(user)) << user;
    size_t files = 0;
    for (const auto& each : std::filesystem::directory_iterator(world.store.stateDirectory() + "/own"))
        files += each.path().extension() == ".password";
    EXPECT_EQ(files, 0u);
}

// Two who know one password: whoever changes it first has the account, and the other one learns that.
TEST_F(OwnPassword, OfManyWhoChangeItAtOnceOneWins) {
    constexpr int kAtOnce = 8;
    const auto word = [](int i) { return "the word of number " + std::to_string(i); };
    std::vector<std::future<int>> answers;
    for (int i = 0; i < kAtOnce; ++i)
        answers.push_back(std::async(std::launch::async, [&, i] { return change("sam", "sam", word(i)); }));
    int winner = -1;
    for (int i = 0; i < kAtOnce; ++i) {
        const int status = answers[static_cast<size_t>(i)].get();
        if (status == 204) {
            EXPECT_EQ(winner, -1) << "two have changed it";
            winner = i;
        } else {
            EXPECT_TRUE(status == 409 || status == 401) << status;
        }
    }
    ASSERT_NE(winner, -1);
    for (int i = 0; i < kAtOnce; ++i)
        EXPECT_EQ(CurlClient(world.store, "sam", word(i)).request("PROPFIND", "/sam/", {"Depth: 0"}).status,
                  i == winner ? 207 : 401)
            << i;
    EXPECT_EQ(change("sam", "sam", word(winner)), 401) << "the same request once more";
}

TEST_F(OwnPassword, EndsWithTheAccount) {
    ASSERT_EQ(change("sam", "sam", "another long word"), 204);
    const CurlClient chosen(world.store, "sam", "another long word");
    ASSERT_EQ(chosen.request("PROPFIND", "/sam/", {"Depth: 0"}).status, 207);
    ASSERT_TRUE(world.store.removeUser("sam"));
    EXPECT_EQ(chosen.request("PROPFIND", "/sam/", {"Depth: 0"}).status, 401);
    EXPECT_FALSE(signsIn("sam"));
    world.store.addUser("sam", rawPasswordOf("sam"));
    EXPECT_EQ(chosen.request("PROPFIND", "/sam/", {"Depth: 0"}).status, 401) << "the account is another one";
    EXPECT_TRUE(signsIn("sam"));
}

TEST_F(OwnPassword, IsRefusedInOtherForms) {
    EXPECT_EQ(change("sam", "sam", "another long word", "text/plain"), 415);
    EXPECT_EQ(change("sam", "sam", "another long word", "application/x-www-form-urlencoded"), 415);
    EXPECT_EQ(change("sam", "sam", "short"), 422);
    EXPECT_EQ(change("sam", "sam", "two\nlines of it"), 422);
    EXPECT_EQ(change("sam", "sam", std::string(73, 'x')), 422);
    EXPECT_EQ(change("sam", "sam", std::string(1 << 20, 'x')), 422);
    EXPECT_EQ(change("sam", "sam", ""), 400);
    EXPECT_TRUE(signsIn("sam"));
    EXPECT_EQ(change("sam", "sam", std::string(72, 'x')), 204);
}

TEST(OwnPasswordElsewhere, IsNotForDigestWhoseFileItWouldNotChange) {
    AccessWorld world(AccessVariant::digest);
    EXPECT_EQ(world.status("sam", "POST", "/principals/users/sam", {{"Content-Type", "application/x-rolvane-password"}},
                           "another long word"),
              405);
}

} // namespace
} // namespace rolvane
