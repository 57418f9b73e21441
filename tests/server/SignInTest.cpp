#include "AccessWorld.h"
#include "foundation/Paths.h"
#include "server/mod_davacl/PasswordLines.h"
#include "server/mod_davacl/SignInMemory.h"

#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <set>
#include <sys/stat.h>
#include <unistd.h>

namespace rolvane {
namespace {

using davacl::PasswordLines;
using davacl::SignInMemory;
using testing::HasSubstr;
using testing::Not;

struct Unmapped {
    void operator()(SignInMemory* memory) const { memory->unmap(); }
};
using Memory = std::unique_ptr<SignInMemory, Unmapped>;

TEST(SignInMemory, KnowsASignInByUserLineAndPasswordTogether) {
    const Memory memory(SignInMemory::map());
    ASSERT_TRUE(memory);
    const auto knows = [&](const char* user, const char* line, const char* password) {
        return memory->knows(memory->markOf(user, line, password));
    };
    EXPECT_FALSE(knows("alice", "hash", "word"));
    memory->remember(memory->markOf("alice", "hash", "word"));
    EXPECT_TRUE(knows("alice", "hash", "word"));
    EXPECT_FALSE(knows("alice", "hash", "other"));
    EXPECT_FALSE(knows("alice", "another hash", "word")) << "the password was changed";
    EXPECT_FALSE(knows("bob", "hash", "word"));
    EXPECT_FALSE(knows("aliceh", "ash", "word")) << "fields do not run into each other";
}

TEST(SignInMemory, ForgetsOldOnesWhenItIsFullAndNeverTakesOneForAnother) {
    const Memory memory(SignInMemory::map());
    constexpr int kMany = 20000;
    for (int i = 0; i < kMany; ++i) memory->remember(memory->markOf("u" + std::to_string(i), "hash", "word"));
    int known = 0;
    for (int i = 0; i < kMany; ++i) {
        known += memory->knows(memory->markOf("u" + std::to_string(i), "hash", "word"));
        EXPECT_FALSE(memory->knows(memory->markOf("u" + std::to_string(i), "hash", "other")));
    }
    EXPECT_GT(known, 4000);
    EXPECT_LE(known, 8192);
    EXPECT_TRUE(memory->knows(memory->markOf("u19999", "hash", "word")));
}

TEST(SignInMemory, HoldsNoPassword) {
    const Memory memory(SignInMemory::map());
    const std::string password = "a long and private word", line = "$2y$10$abcdefghijklmnopqrstuu";
    memory->remember(memory->markOf("alice", line, password));
    const std::string bytes(reinterpret_cast<const char*>(memory.get()), sizeof(SignInMemory));
    for (const std::string& text : {password, line, std::string("alice")})
        EXPECT_EQ(bytes.find(text), std::string::npos) << text;
}

TEST(PasswordLines, AreThoseOfTheFileAtThisMoment) {
    const StoreDirectory directory;
    const std::string path = directory.path("passwords");
    PasswordLines lines;
    const auto hash = [&](const char* user) { return lines.find(path, user).hash; };
    EXPECT_EQ(lines.find(path, "alice").answer, PasswordLines::Answer::unreadable);
    std::ofstream(path) << "# a comment\n\nalice:one:Alice\r\nalice:second\nbob:two\n";
    EXPECT_EQ(hash("alice"), "one");
    EXPECT_EQ(hash("bob"), "two");
    EXPECT_EQ(lines.find(path, "carol").answer, PasswordLines::Answer::unknown);
    // Written in place, with the same size, and with the times of before.
    struct stat before {};
    ASSERT_EQ(stat(path.c_str(), &before), 0);
    std::ofstream(path) << "# a comment\n\nalice:eno:Alice\r\nalice:second\nbob:owt\n";
    const timespec times[] = {before.st_atim, before.st_mtim};
    ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
    EXPECT_EQ(hash("alice"), "eno");
    std::ofstream(path) << "bob:owt\n";
    EXPECT_EQ(lines.find(path, "alice").answer, PasswordLines::Answer::unknown);
    std::filesystem::remove(path);
    EXPECT_EQ(lines.find(path, "bob").answer, PasswordLines::Answer::unreadable);
}

PrivateStoreOptions thatCounts() {
    PrivateStoreOptions options;
    options.extraConfiguration = {"LogLevel davacl:debug"};
    return options;
}

class SigningIn : public testing::Test {
protected:
    SigningIn() : world(thatCounts()) { world.reset(); }
    size_t fullChecks(const std::string& user) const {
        const std::string log = readFile(world.store.errorLog());
        const std::string line = "the password of " + user + " is checked in full";
        size_t count = 0;
        for (size_t at = 0; (at = log.find(line, at)) != std::string::npos; at += line.size()) ++count;
        return count;
    }
    int signIn(const std::string& user, const std::string& password) const {
        return std::atoi(
            runCommand({"curl", "-q", "-sS", "--noproxy", "*", "-o", "/dev/null", "-w", "%{http_code}", "-u",
                        user + ":" + password, "http://localhost:" + std::to_string(world.port()) + "/dav/alice/own"})
                .output.c_str());
    }
    AccessWorld world;
};

TEST_F(SigningIn, ASlowHashIsPaidOnceForAUserAndNotForEachRequest) {
    for (int i = 0; i < 40; ++i) EXPECT_EQ(world.status("alice", "GET", "/dav/alice/own"), 200);
    EXPECT_EQ(fullChecks("alice"), 1u);
    EXPECT_EQ(signIn("alice", "wrong"), 401);
    EXPECT_EQ(signIn("alice", "wrong"), 401);
    EXPECT_EQ(fullChecks("alice"), 3u) << "what is wrong is not remembered";
    EXPECT_EQ(world.status("alice", "GET", "/dav/alice/own"), 200);
    EXPECT_EQ(fullChecks("alice"), 3u);
}

TEST_F(SigningIn, AnUnknownNameIsRefusedAtTheCostOfAKnownOne) {
    const auto checksFor = [this](const std::string& user) {
        const size_t before = fullChecks(user);
        EXPECT_EQ(signIn(user, "wrong"), 401);
        EXPECT_EQ(signIn(user, "wrong"), 401);
        return fullChecks(user) - before;
    };
    EXPECT_EQ(checksFor("alice"), 2u);
    EXPECT_EQ(checksFor("mallory"), 2u);
    // Nobody is let in by somebody else's password.
    for (const char* name : {"mallory", "trudy", "oscar", "eve"})
        for (const char* known : {"alice", "walter", "rita", "sam", "greta"})
            EXPECT_EQ(signIn(name, rawPasswordOf(known)), 401) << name << " with the password of " << known;
}

TEST(PasswordLines, AnUnknownNameCostsWhatALineOfTheFileCosts) {
    const davacl::PasswordHashes hashes = davacl::passwordHashes("alice:$2y$10$one\nbob:$apr1$two\n");
    std::set<std::string> used;
    for (uint64_t number = 0; number < 4; ++number) used.insert(davacl::hashInstead(hashes, number));
    EXPECT_EQ(used, (std::set<std::string>{"$2y$10$one", "$apr1$two"}));
    EXPECT_EQ(davacl::hashInstead(hashes, 7), davacl::hashInstead(hashes, 7));
    EXPECT_EQ(davacl::hashInstead({}, 7).rfind("$2y$10$", 0), 0u)
        << "nobody is known: as the private store writes them";
}

TEST_F(SigningIn, AChangedPasswordIsRefusedAtTheNextRequest) {
    const std::string old = rawPasswordOf("alice");
    ASSERT_EQ(signIn("alice", old), 200);
    world.store.addUser("alice", "another one");
    EXPECT_EQ(signIn("alice", old), 401);
    EXPECT_EQ(signIn("alice", "another one"), 200);
    world.store.addUser("alice", old);
    EXPECT_EQ(signIn("alice", "another one"), 401);
    EXPECT_EQ(signIn("alice", old), 200);
    ASSERT_TRUE(world.store.removeUser("alice"));
    EXPECT_EQ(signIn("alice", old), 401);
}

TEST_F(SigningIn, LinesThatEarlierVersionsAndHtpasswdWroteAreTaken) {
    const std::string passwords = world.store.stateDirectory() + "/conf/passwords";
    for (const char* form : {"-m", "-B", "-s"}) {
        const CommandResult line = runCommand({"htpasswd", "-n", "-i", form, "alice"}, "an old word\n");
        ASSERT_EQ(line.status, 0) << line.errors;
        std::ofstream(passwords) << line.output;
        EXPECT_EQ(signIn("alice", "an old word"), 200) << form;
        EXPECT_EQ(signIn("alice", rawPasswordOf("alice")), 401) << form;
    }
}

TEST(DigestOfAStore, IsKeptOnlyWhereItIsAskedFor) {
    const StoreDirectory directory;
    PrivateStoreOptions options = optionsIn(directory);
    options.tls = false;
    const std::string digests = directory.path("store/conf/digests");
    {
        PrivateStore store(options);
        store.addUser("alice", "word");
        // As an earlier version left it.
        writeFileDurably(digests, "alice:Rolvane:0123456789abcdef0123456789abcdef\n");
        store.start();
        EXPECT_FALSE(std::filesystem::exists(digests));
        EXPECT_EQ(CurlClient(store, "alice", "word").request("PUT", "/alice/x", {}, "x").status, 201);
    }
    options.authentication = StoreAuthentication::digest;
    try {
        PrivateStore(options).start();
        FAIL() << "nobody could sign in";
    } catch (const std::exception& e) {
        EXPECT_THAT(e.what(), testing::AllOf(HasSubstr("alice"), HasSubstr("store user add")));
    }
    PrivateStoreOptions saved = PrivateStore::savedOptions(options.stateDirectory).value();
    EXPECT_EQ(saved.authentication, StoreAuthentication::digest);
    saved.ownsProcess = true;
    PrivateStore store(saved);
    store.addUser("alice", "word");
    store.start();
    EXPECT_EQ(CurlClient(store, "alice", "word", "--digest").request("PUT", "/alice/x", {}, "y").status, 204);
    EXPECT_EQ(CurlClient(store, "alice", "no", "--digest").request("GET", "/alice/x").status, 401);
}

TEST(PasswordOfAStore, IsNotLongerThanWhatCounts) {
    const StoreDirectory directory;
    PrivateStore store(optionsIn(directory));
    EXPECT_NO_THROW(store.addUser("alice", std::string(72, 'x')));
    EXPECT_ANY_THROW(store.addUser("alice", std::string(73, 'x')));
}

} // namespace
} // namespace rolvane
