#include "server/PasswordFile.h"

#include "StoreTestWorld.h"
#include "foundation/Paths.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace rolvane {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::Not;

std::string opensslsOpinion(const std::string& password, const std::string& salt) {
    std::string line = runCommand({"openssl", "passwd", "-apr1", "-salt", salt, "-stdin"}, password + "\n").output;
    return line.substr(0, line.find('\n'));
}

PasswordFile fileIn(const StoreDirectory& directory) {
    return PasswordFile(directory.path("passwords"), directory.path("digests"), "Rolvane");
}

TEST(PasswordFile, StretchesPasswordsAsOpenSSLDoes) {
    for (const std::string password :
         {"a", "fifteen letters", "sixteen letters.", "more than sixteen letters and \xc3\xa9"})
        for (const std::string salt : {"saltsalt", "a./Z09"})
            EXPECT_EQ(aprMD5Password(password, salt), opensslsOpinion(password, salt)) << password;
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

TEST(PasswordFile, SaltsEveryEntryAnew) {
    const StoreDirectory directory;
    PasswordFile file = fileIn(directory);
    file.set("alice", "same");
    const std::string first = readFile(directory.path("passwords"));
    file.set("alice", "same");
    EXPECT_NE(readFile(directory.path("passwords")), first);
}

TEST(PasswordFile, KeepsTheDigestOfUserRealmAndPassword) {
    const StoreDirectory directory;
    fileIn(directory).set("alice", "pw");
    const std::string expected = runCommand({"openssl", "md5", "-r"}, "alice:Rolvane:pw").output.substr(0, 32);
    EXPECT_EQ(readFile(directory.path("digests")), "alice:Rolvane:" + expected + "\n");
}

TEST(PasswordFile, ReplacesAndRemovesOneUserAndLeavesTheOthers) {
    const StoreDirectory directory;
    PasswordFile file = fileIn(directory);
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
