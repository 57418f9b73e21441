#include "StoreTestWorld.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"
#include "server/StoreProcess.h"
#include "support/ChildProcess.h"

#include <cerrno>
#include <fcntl.h>
#include <filesystem>
#include <gmock/gmock.h>
#include <sys/stat.h>
#include <unistd.h>

// A store that root starts, and the user whom its httpd runs as, who would like to be root. An ordinary user's launcher
// has no more rights than its httpd, so there is nothing to attack: the suite has tests where root runs it.

namespace rolvane {
namespace {

using testing::HasSubstr;

struct stat statusOf(const std::string& path) {
    struct stat info {};
    EXPECT_EQ(lstat(path.c_str(), &info), 0) << path;
    return info;
}

class RootsStore : public testing::TestWithParam<std::string> {
protected:
    // The server's user gets as far as the store: nothing but the store itself stops an attack.
    void SetUp() override { ASSERT_EQ(chmod(directory.path().c_str(), 0711), 0); }
    const StoreIdentity& server() const { return _server; }

    // The form in which earlier versions left a store: everything belongs to httpd's user.
    void leaveAllToTheServer() const {
        const auto give = [&](const std::string& path) {
            ASSERT_EQ(lchown(path.c_str(), server().uid, server().gid), 0) << path;
        };
        give(state);
        for (const auto& entry : std::filesystem::recursive_directory_iterator(state)) give(entry.path());
    }
    // Something of root's that httpd's user must get no hand on.
    std::string rootsDirectory() const {
        const std::string path = directory.path("roots");
        EXPECT_EQ(mkdir(path.c_str(), 0700), 0);
        writeFileDurably(path + "/secret", "of root\n", 0600);
        return path;
    }
    void expectUntouched(const std::string& path) const {
        EXPECT_EQ(statusOf(path).st_uid, 0u) << path;
        EXPECT_EQ(statusOf(path + "/secret").st_uid, 0u);
        EXPECT_EQ(readFile(path + "/secret"), "of root\n");
        EXPECT_EQ(std::distance(std::filesystem::directory_iterator(path), {}), 1) << "something was put there";
    }
    PrivateStoreOptions options() const {
        PrivateStoreOptions chosen;
        chosen.stateDirectory = state;
        chosen.ownsProcess = true;
        return chosen;
    }
    std::string reasonOf(const std::function<void()>& action) const {
        try {
            action();
        } catch (const CXException& e) {
            return e.reason();
        }
        return "nothing was refused";
    }

    const StoreDirectory directory;
    const std::string state = directory.path("state");

private:
    const StoreIdentity _server = StoreIdentity::choose();
};

TEST_P(RootsStore, GivesTheServerItsOwnDirectoriesAndNothingThatRootWrites) {
    PrivateStore store(options());
    store.addUser("alice", "a");
    store.start();
    for (const char* name : {"", "/conf", "/tls", "/root", "/startup.log", "/store.plist", "/launcher.lock",
                             "/conf/httpd.conf", "/conf/passwords", "/tls/server.key"})
        EXPECT_EQ(statusOf(state + name).st_uid, 0u) << name;
    for (const char* name : {"/run", "/logs", "/locks", "/lists", "/root/dav", "/root/dav/alice"})
        EXPECT_EQ(statusOf(state + name).st_uid, server().uid) << name;
    for (const char* name : {"/conf/httpd.conf", "/conf/passwords", "/tls/server.key"}) {
        EXPECT_EQ(statusOf(state + name).st_mode & 07777, 0640u) << name;
        EXPECT_EQ(statusOf(state + name).st_gid, server().gid) << name;
    }
    EXPECT_EQ(CurlClient(store, "alice", "a").request("PUT", "/alice/x", {}, "x").status, 201);
}

TEST_P(RootsStore, LetsTheServersUserReplaceNothingThatRootUses) {
    PrivateStore store(options());
    store.addUser("alice", "a");
    store.start();
    store.stop();
    for (const char* name : {"/run", "/logs", "/locks", "/lists", "/conf", "/tls", "/root", "/root/dav"}) {
        const std::string path = state + name, aside = path + ".aside";
        const int error = server().run([&] { return rename(path.c_str(), aside.c_str()) == 0 ? 0 : errno; });
        EXPECT_EQ(error, EACCES) << path;
    }
    const std::string own = state + "/run/own";
    EXPECT_EQ(server().run([&] { return open(own.c_str(), O_WRONLY | O_CREAT, 0600) >= 0 ? 0 : errno; }), 0)
        << "the server's user does not get that far";
    for (const char* name : {"/startup.log", "/conf/passwords", "/store.plist"}) {
        const std::string path = state + name;
        EXPECT_EQ(server().run([&] { return open(path.c_str(), O_WRONLY | O_TRUNC) >= 0 ? 0 : errno; }), EACCES)
            << path;
        EXPECT_EQ(server().run([&] { return unlink(path.c_str()) == 0 ? 0 : errno; }), EACCES) << path;
    }
}

TEST_P(RootsStore, HandsOverNothingBehindALinkInThePlaceOfTheLocks) {
    {
        PrivateStore store(options());
        store.addUser("alice", "a");
    }
    leaveAllToTheServer();
    const std::string victim = rootsDirectory();
    std::filesystem::remove_all(state + "/locks");
    std::filesystem::create_symlink(victim, state + "/locks");
    EXPECT_THAT(reasonOf([&] { PrivateStore(options()).addUser("bob", "b"); }), HasSubstr("is a link"));
    expectUntouched(victim);
}

TEST_P(RootsStore, TruncatesNothingBehindALinkInThePlaceOfTheStartLog) {
    {
        PrivateStore store(options());
        store.addUser("alice", "a");
    }
    leaveAllToTheServer();
    const std::string victim = rootsDirectory();
    for (const char* name : {"/logs/startup.log", "/startup.log", "/logs/access.log"})
        std::filesystem::create_symlink(victim + "/secret", state + name);
    PrivateStore(options()).start();
    expectUntouched(victim);
    std::filesystem::remove(state + "/startup.log");
    std::filesystem::create_hard_link(victim + "/secret", state + "/startup.log");
    PrivateStore(options()).start();
    expectUntouched(victim);
}

TEST_P(RootsStore, MakesNoTreeBehindALinkInThePlaceOfTheDocuments) {
    {
        PrivateStore store(options());
        store.addUser("alice", "a");
    }
    leaveAllToTheServer();
    const std::string victim = rootsDirectory();
    std::filesystem::remove_all(state + "/root/dav");
    std::filesystem::create_symlink(victim, state + "/root/dav");
    writeFileDurably(state + "/conf/passwords", readFile(state + "/conf/passwords") + "secret:$apr1$x$y\n", 0600);
    ASSERT_EQ(chown((state + "/conf/passwords").c_str(), server().uid, server().gid), 0);
    EXPECT_THAT(reasonOf([&] { PrivateStore(options()).addUser("bob", "b"); }), HasSubstr("is a link"));
    EXPECT_THAT(reasonOf([&] { PrivateStore(options()).start(); }), HasSubstr("is a link"));
    expectUntouched(victim);
}

TEST_P(RootsStore, TakesNoFileOfRootsIntoItsConfigurationByASecondName) {
    {
        PrivateStore store(options());
        store.addUser("alice", "a");
    }
    leaveAllToTheServer();
    const std::string victim = rootsDirectory();
    std::filesystem::create_hard_link(victim + "/secret", state + "/conf/groups");
    EXPECT_THAT(reasonOf([&] { PrivateStore(options()).start(); }), HasSubstr("second name"));
    EXPECT_EQ(statusOf(victim + "/secret").st_mode & 07777, 0600u);
    expectUntouched(victim);
}

TEST_P(RootsStore, TakesBackAStoreOfAnEarlierVersion) {
    {
        PrivateStore store(options());
        store.addUser("alice", "a");
        store.start();
        ASSERT_EQ(CurlClient(store, "alice", "a").request("PUT", "/alice/x", {}, "x").status, 201);
    }
    leaveAllToTheServer();
    PrivateStore store(options());
    store.start();
    EXPECT_EQ(statusOf(state).st_uid, 0u);
    EXPECT_EQ(statusOf(state + "/conf/passwords").st_uid, 0u);
    EXPECT_EQ(CurlClient(store, "alice", "a").request("GET", "/alice/x").body, "x");
}

TEST_P(RootsStore, DoesNotLieWhereSomebodyElseMayMoveIt) {
    ASSERT_EQ(mkdir(directory.path("theirs").c_str(), 0700), 0);
    ASSERT_EQ(chown(directory.path("theirs").c_str(), server().uid, server().gid), 0);
    PrivateStoreOptions within = options();
    within.stateDirectory = directory.path("theirs/store");
    EXPECT_THAT(reasonOf([&] { PrivateStore(within).start(); }), HasSubstr("must not lie below"));
    PrivateStoreOptions documents = options();
    documents.documentRoot = directory.path("theirs/documents");
    EXPECT_THAT(reasonOf([&] { PrivateStore(documents).start(); }), HasSubstr("must not lie below"));
}

// Who owns the directory of the documents may put a link in the place of the trees at any time.
TEST_P(RootsStore, DoesNotServeDocumentsFromADirectoryOfSomebodyElse) {
    constexpr uid_t kSomebody = 54321;
    PrivateStoreOptions documents = options();
    documents.documentRoot = directory.path("documents");
    ASSERT_EQ(mkdir(documents.documentRoot.c_str(), 0755), 0);
    ASSERT_EQ(chown(documents.documentRoot.c_str(), kSomebody, kSomebody), 0);
    EXPECT_THAT(reasonOf([&] { PrivateStore(documents).start(); }), HasSubstr("belongs to another user"));
    EXPECT_EQ(statusOf(documents.documentRoot).st_uid, kSomebody);
    EXPECT_TRUE(std::filesystem::is_empty(documents.documentRoot));
    ASSERT_EQ(chown(documents.documentRoot.c_str(), 0, 0), 0);
    ASSERT_EQ(chmod(documents.documentRoot.c_str(), 0777), 0);
    EXPECT_THAT(reasonOf([&] { PrivateStore(documents).start(); }), HasSubstr("somebody else may change"));
    ASSERT_EQ(chmod(documents.documentRoot.c_str(), 0755), 0);
    PrivateStore store(documents);
    store.start();
}

// The number of the process stands where httpd's user writes.
TEST_P(RootsStore, EndsNoProgramOfRootsForANumberInTheServersFile) {
    PrivateStore store(options());
    store.addUser("alice", "a");
    store.start();
    store.stop();
    test::ChildProcess reader(
        {"sh", "-c", "tail -n +1 -f \"$1\" > /dev/null & echo number $!; wait", "sh", state + "/conf/httpd.conf"});
    const auto line = reader.waitForLine("^number ");
    ASSERT_TRUE(line);
    const std::string forged = state + "/run/httpd.pid", number = line->substr(7) + "\n";
    ASSERT_EQ(server().run([&] {
        const int file = open(forged.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
        return write(file, number.data(), number.size()) == static_cast<ssize_t>(number.size()) ? 0 : 1;
    }),
              0);
    EXPECT_FALSE(store.status().running);
    store.stop(PrivateStore::Stop::atOnce);
    EXPECT_TRUE(reader.running());
    store.start();
    EXPECT_TRUE(reader.running()) << "what is left of an earlier httpd is ended, and nothing else";
}

TEST_P(RootsStore, DoesNotTakeADirectoryThatServesSomethingElse) {
    const std::string victim = rootsDirectory();
    PrivateStoreOptions there = options();
    there.stateDirectory = victim;
    EXPECT_THAT(reasonOf([&] { PrivateStore(there).start(); }), HasSubstr("holds other things"));
    expectUntouched(victim);
}

TEST_P(RootsStore, ReadsNoLinkThatTheServersUserPutsInThePlaceOfItsFiles) {
    const std::string victim = rootsDirectory();
    PrivateStore store(options());
    store.addUser("alice", "a");
    store.start();
    store.stop();
    const std::string log = state + "/logs/error.log", secret = victim + "/secret";
    ASSERT_EQ(
        server().run([&] { return unlink(log.c_str()) == 0 && symlink(secret.c_str(), log.c_str()) == 0 ? 0 : 1; }), 0);
    PrivateStoreOptions broken = options();
    broken.extraConfiguration = {"NoSuchDirective"};
    EXPECT_THAT(reasonOf([&] { PrivateStore(broken).start(); }),
                testing::AllOf(HasSubstr("did not start"), testing::Not(HasSubstr("of root"))));
    expectUntouched(victim);
}

std::vector<std::string> whomToGuardAgainst() {
    const StoreIdentity identity = StoreIdentity::choose();
    return identity.change ? std::vector{identity.name} : std::vector<std::string>();
}

GTEST_ALLOW_UNINSTANTIATED_PARAMETERIZED_TEST(RootsStore);
INSTANTIATE_TEST_SUITE_P(Server, RootsStore, testing::ValuesIn(whomToGuardAgainst()));

} // namespace
} // namespace rolvane
