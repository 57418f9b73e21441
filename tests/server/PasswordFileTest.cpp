#include "server/PasswordFile.h"

#include "StoreTestWorld.h"
#include "foundation/Paths.h"

#include <filesystem>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace rolvane {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::Not;

constexpr int kQuickly = 4;

PasswordFile fileIn(const StoreDirectory& directory, bool digests = false) {
    return PasswordFile(directory.path("passwords"), directory.path("digests"), "Rolvane",
                        {.digests = digests, .cost = kQuickly, .mode = 0600});
}

TEST(PasswordFile, IsBelievedByHttpdsOwnChecker) {
    const StoreDirectory directory;
    PasswordFile file = fileIn(directory);
    file.set("alice", "wonder land");
    const auto verify = [&](const std::string& password) {
        return runCommand({"htpasswd", "-vi", directory.path("passwords"), "alice"}, password + "\n").status;
    };
    EXPECT_EQ(verify("wonder land"), 0);
    EXPECT_EQ(verify("wonderland"), 3);
}

TEST(PasswordFile, KeepsASlowHash) {
    const StoreDirectory directory;
    PasswordFile(directory.path("passwords"), directory.path("digests"), "Rolvane", {}).set("alice", "wonder land");
    EXPECT_THAT(readFile(directory.path("passwords")), testing::StartsWith("alice:$2y$10$"));
}

TEST(PasswordFile, SaltsEveryEntryAnew) {
    const StoreDirectory directory;
    PasswordFile file = fileIn(directory);
    file.set("alice", "same");
    const std::string first = readFile(directory.path("passwords"));
    file.set("alice", "same");
    EXPECT_NE(readFile(directory.path("passwords")), first);
}

TEST(PasswordFile, KeepsNoDigestUnlessAsked) {
    const StoreDirectory directory;
    PasswordFile file = fileIn(directory);
    file.set("alice", "pw");
    EXPECT_FALSE(std::filesystem::exists(directory.path("digests")));
    EXPECT_THAT(file.usersWithoutDigest(), ElementsAre("alice"));
    writeFileDurably(directory.path("digests"), "alice:Rolvane:0123\n");
    EXPECT_TRUE(file.usersWithoutDigest().empty());
    file.dropDigests();
    EXPECT_FALSE(std::filesystem::exists(directory.path("digests")));
}

TEST(PasswordFile, KeepsTheDigestOfUserRealmAndPassword) {
    const StoreDirectory directory;
    fileIn(directory, true).set("alice", "pw");
    const std::string expected = runCommand({"openssl", "md5", "-r"}, "alice:Rolvane:pw").output.substr(0, 32);
    EXPECT_EQ(readFile(directory.path("digests")), "alice:Rolvane:" + expected + "\n");
}

TEST(PasswordFile, ReplacesAndRemovesOneUserAndLeavesTheOthers) {
    const StoreDirectory directory;
    PasswordFile file = fileIn(directory, true);
    EXPECT_TRUE(file.users().empty());
    for (const char* user : {"carol", "alice", "bob", "alice"}) file.set(user, "x");
    EXPECT_THAT(file.users(), ElementsAre("alice", "bob", "carol"));
    EXPECT_TRUE(file.remove("bob"));
    EXPECT_FALSE(file.remove("bob"));
    EXPECT_THAT(file.users(), ElementsAre("alice", "carol"));
    EXPECT_THAT(readFile(directory.path("digests")), Not(HasSubstr("bob")));
}

TEST(PasswordFile, LeavesOutLinesThatAreNoEntries) {
    const StoreDirectory directory;
    writeFileDurably(directory.path("passwords"), "alice:$apr1$x$y\nno colon\n../bob:x\n:x\n\n");
    EXPECT_THAT(fileIn(directory).users(), ElementsAre("alice"));
}

} // namespace
} // namespace rolvane
