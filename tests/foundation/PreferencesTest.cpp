#include "foundation/Preferences.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"
#include "support/ChildProcess.h"
#include "support/TempHome.h"

#include <csignal>
#include <filesystem>
#include <fstream>
#include <functional>
#include <thread>

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

using namespace rolvane;
using namespace rolvane::test;
namespace fs = std::filesystem;

namespace {

struct PreferencesOf : testing::Test {
    TempDirectory directory;
    std::string path = directory / "state/preferences.db";
    Preferences preferences{path, 0.05};

    std::string contents() const {
        std::ifstream file(path, std::ios::binary);
        return {std::istreambuf_iterator<char>(file), {}};
    }
    void overwrite(const std::string& bytes) {
        fs::create_directories(fs::path(path).parent_path());
        std::ofstream(path, std::ios::binary) << bytes;
    }
    // What the sqlite3 program says about the file.
    std::string sqlite(const std::string& sql) const {
        ChildProcess child({"sqlite3", path, sql});
        auto ending = child.wait();
        EXPECT_TRUE(ending && ending->exitedWith(0)) << child.errors();
        return child.output();
    }
    void store(const std::string& key, Value value) {
        preferences.set("domain", key, std::move(value));
        preferences.synchronize("domain");
    }
    std::string complaintOf(const std::function<void()>& work, const char* name = kCXPreferencesException) {
        try {
            work();
        } catch (const CXException& e) {
            EXPECT_EQ(e.name(), name);
            return e.reason();
        }
        return "nothing was thrown";
    }
    void expectComplaint(const std::function<void()>& work, const std::vector<std::string>& parts,
                         const char* name = kCXPreferencesException) {
        std::string complaint = complaintOf(work, name);
        for (const auto& part : parts)
            EXPECT_NE(complaint.find(part), std::string::npos) << part << " in: " << complaint;
        EXPECT_NE(complaint.find(path), std::string::npos) << complaint;
    }
};

// Runs the work in a forked process; its exit status is the work's result. For programs without other threads.
pid_t forked(const std::function<int()>& work) {
    pid_t child = ::fork();
    if (child == 0) {
        int status = 99;
        try {
            status = work();
        } catch (...) {
        }
        ::_exit(status);
    }
    return child;
}

int statusOf(pid_t child) {
    int status = 0;
    ::waitpid(child, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
}

} // namespace

TEST_F(PreferencesOf, ReadingMakesNoFile) {
    EXPECT_TRUE(preferences.get("domain", "key").isAbsent());
    EXPECT_TRUE(preferences.keys("domain").empty());
    EXPECT_TRUE(preferences.domains().empty());
    preferences.synchronize("domain");
    EXPECT_FALSE(fs::exists(directory / "state"));
}

TEST_F(PreferencesOf, AChangeIsSeenHereAtOnceAndElsewhereAfterSynchronizing) {
    Preferences other(path);
    preferences.set("domain", "CXDShareCount", 7);
    EXPECT_EQ(preferences.get("domain", "CXDShareCount"), Value(7));
    EXPECT_TRUE(other.get("domain", "CXDShareCount").isAbsent());
    preferences.synchronize("domain");
    EXPECT_EQ(other.get("domain", "CXDShareCount"), Value(7));
}

TEST_F(PreferencesOf, EveryKindOfValueComesBackAsItWas) {
    Dictionary all{{"boolean", false},
                   {"integer", int64_t(1) << 60},
                   {"real", 0.1},
                   {"string", std::string("with \0 inside", 13)},
                   {"date", Date(1.5)},
                   {"data", Bytes{0, 255}},
                   {"array", Array{1, "two", Array{}}},
                   {"dictionary", Dictionary{{"key", Dictionary{}}}}};
    for (const auto& [key, value] : all) preferences.set("domain", key, value);
    preferences.synchronize("domain");
    Preferences other(path);
    for (const auto& [key, value] : all) {
        EXPECT_EQ(other.get("domain", key), value) << key;
        EXPECT_EQ(other.get("domain", key).type(), value.type()) << key;
    }
}

TEST_F(PreferencesOf, OtherProcessesChangesAreSeenByTheNextRead) {
    store("key", "ours");
    EXPECT_EQ(statusOf(forked([&] {
                  Preferences other(path);
                  other.set("domain", "key", "theirs");
                  other.synchronize("domain");
                  return 0;
              })),
              0);
    EXPECT_EQ(preferences.get("domain", "key"), Value("theirs"));
}

TEST_F(PreferencesOf, AnUnwrittenChangeHidesWhatOthersWriteUntilItIsWritten) {
    store("key", 1);
    preferences.set("domain", "key", 2);
    Preferences other(path);
    other.set("domain", "key", 3);
    other.synchronize("domain");
    EXPECT_EQ(preferences.get("domain", "key"), Value(2));
    preferences.synchronize("domain");
    EXPECT_EQ(other.get("domain", "key"), Value(2));
}

TEST_F(PreferencesOf, SynchronizingOneDomainLeavesTheOthersUnwritten) {
    preferences.set("one", "key", 1);
    preferences.set("two", "key", 2);
    preferences.synchronize("one");
    Preferences other(path);
    EXPECT_EQ(other.domains(), (std::vector<std::string>{"one"}));
    EXPECT_EQ(preferences.domains(), (std::vector<std::string>{"one", "two"}));
}

TEST_F(PreferencesOf, OnlyTheKeysThatWereChangedAreWritten) {
    store("a", 1);
    store("b", 1);
    preferences.set("domain", "a", 2);
    Preferences other(path);
    other.set("domain", "b", 3);
    other.synchronize("domain");
    preferences.synchronize("domain");
    EXPECT_EQ(preferences.get("domain", "b"), Value(3));
}

TEST_F(PreferencesOf, RemovingAndSettingAnAbsentValueAreTheSame) {
    store("a", 1);
    store("b", 1);
    store("c", 1);
    preferences.remove("domain", "a");
    preferences.set("domain", "b", Value());
    EXPECT_TRUE(preferences.get("domain", "a").isAbsent());
    EXPECT_EQ(preferences.keys("domain"), (std::vector<std::string>{"c"}));
    preferences.synchronize("domain");
    EXPECT_EQ(Preferences(path).keys("domain"), (std::vector<std::string>{"c"}));
}

TEST_F(PreferencesOf, KeysAndDomainsAreSortedAndIncludeUnwrittenChanges) {
    store("b", 1);
    preferences.set("domain", "a", 1);
    preferences.set("another", "x", 1);
    EXPECT_EQ(preferences.keys("domain"), (std::vector<std::string>{"a", "b"}));
    EXPECT_EQ(preferences.domains(), (std::vector<std::string>{"another", "domain"}));
    preferences.remove("domain", "a");
    preferences.remove("domain", "b");
    EXPECT_EQ(preferences.domains(), (std::vector<std::string>{"another"}));
}

TEST_F(PreferencesOf, AValueIsCopiedWhenItIsSet) {
    Dictionary state{{"count", 1}};
    preferences.set("domain", "state", state);
    state.set("count", 2);
    EXPECT_EQ(preferences.get("domain", "state").dictionary()["count"], Value(1));
    preferences.get("domain", "state").dictionary().set("count", 3);
    preferences.synchronize("domain");
    EXPECT_EQ(Preferences(path).get("domain", "state").dictionary()["count"], Value(1));
}

TEST_F(PreferencesOf, TheFileIsForItsOwnerOnlyWhateverTheUmask) {
    mode_t former = ::umask(0);
    store("key", 1);
    ::umask(former);
    for (const char* suffix : {"", "-wal", "-shm"}) {
        struct stat st {};
        ASSERT_EQ(::stat((path + suffix).c_str(), &st), 0) << suffix;
        EXPECT_EQ(st.st_mode & 0777, 0600u) << suffix;
    }
    struct stat st {};
    ASSERT_EQ(::stat((directory / "state").c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0700u);
}

TEST_F(PreferencesOf, AnIndependentProgramFindsARowPerDomainAndKey) {
    store("key", 1);
    preferences.set("other", "k2", 2);
    preferences.synchronize("other");
    EXPECT_EQ(sqlite("SELECT domain, key FROM preferences ORDER BY domain"), "domain|key\nother|k2\n");
    EXPECT_EQ(sqlite("PRAGMA integrity_check"), "ok\n");
}

TEST_F(PreferencesOf, ADamagedFileIsNamedExplainedAndLeftAsItIs) {
    store("key", 1);
    preferences.set("domain", "later", 2);
    std::string junk(5000, 'j');
    fs::remove(path + "-wal");
    fs::remove(path);
    overwrite(junk);
    expectComplaint([&] { (void)preferences.get("domain", "key"); }, {"damaged", "left as it is", "mv '"});
    expectComplaint([&] { preferences.synchronize("domain"); }, {"damaged"});
    expectComplaint([&] { (void)preferences.domains(); }, {"damaged"});
    EXPECT_EQ(contents(), junk);
    EXPECT_EQ(preferences.get("domain", "later"), Value(2)) << "the unwritten change is still there";
    fs::rename(path, path + ".damaged");
    preferences.synchronize("domain");
    EXPECT_EQ(Preferences(path).get("domain", "later"), Value(2)) << "and goes into the new file";
}

TEST_F(PreferencesOf, AFileThatIsTornInTheMiddleIsDamagedAndNotAnEmptyOne) {
    for (int i = 0; i < 50; ++i) preferences.set("domain", "key" + std::to_string(i), std::string(3000, 'x'));
    preferences.synchronize("domain");
    sqlite("PRAGMA wal_checkpoint(TRUNCATE)");
    std::string whole = contents();
    ASSERT_GT(whole.size(), 100'000u);
    std::string torn = whole;
    torn.replace(8192, 60'000, std::string(60'000, '\xa5'));
    TempDirectory elsewhere;
    path = elsewhere / "preferences.db";
    overwrite(torn);
    Preferences victim(path);
    expectComplaint(
        [&] {
            for (int i = 0; i < 50; ++i) (void)victim.get("domain", "key" + std::to_string(i));
        },
        {"damaged"});
    EXPECT_EQ(contents(), torn);
}

TEST_F(PreferencesOf, AnEmptyFileIsAFileThatWasJustMade) {
    overwrite("");
    EXPECT_TRUE(preferences.get("domain", "key").isAbsent());
    store("key", 1);
    EXPECT_EQ(Preferences(path).get("domain", "key"), Value(1));
}

TEST_F(PreferencesOf, ADamagedValueIsNamedAndTheOthersAreStillRead) {
    store("good", 1);
    store("bad", 2);
    sqlite("UPDATE preferences SET value = x'ffffffff' WHERE key = 'bad'");
    expectComplaint([&] { (void)preferences.get("domain", "bad"); }, {"\"bad\"", "\"domain\"", "damaged"},
                    kCXArchiveException);
    EXPECT_EQ(preferences.get("domain", "good"), Value(1));
}

TEST_F(PreferencesOf, SomeOtherDatabaseIsNotWrittenTo) {
    fs::create_directories(directory / "state");
    sqlite("CREATE TABLE somebody_elses (x)");
    std::string before = contents();
    preferences.set("domain", "key", 1);
    expectComplaint([&] { preferences.synchronize("domain"); }, {"not a preferences file"});
    EXPECT_EQ(contents(), before);
}

TEST_F(PreferencesOf, AFileOfANewerFormatIsNotTouched) {
    store("key", 1);
    sqlite("PRAGMA user_version=2");
    Preferences older(path);
    expectComplaint([&] { (void)older.get("domain", "key"); }, {"newer version", "Update this program"});
}

TEST_F(PreferencesOf, ALockedFileIsReportedAfterTheTimeoutAndTheChangeIsKept) {
    store("key", 1);
    ChildProcess locker({"sqlite3", "-batch", path});
    locker.writeInput("BEGIN IMMEDIATE; SELECT 'locked';\n");
    ASSERT_TRUE(locker.waitForLine("locked"));
    EXPECT_EQ(preferences.get("domain", "key"), Value(1)) << "reading goes on";
    preferences.set("domain", "key", 2);
    expectComplaint([&] { preferences.synchronize("domain"); }, {"locked by another program", "try again"});
    EXPECT_EQ(preferences.get("domain", "key"), Value(2));
    locker.writeInput("ROLLBACK; SELECT 'released';\n");
    ASSERT_TRUE(locker.waitForLine("released"));
    preferences.synchronize("domain");
    EXPECT_EQ(Preferences(path).get("domain", "key"), Value(2));
}

TEST_F(PreferencesOf, AReadOnlyFileIsReadAndReportedOnWriting) {
    {
        Preferences maker(path);
        maker.set("domain", "key", 1);
        maker.synchronize("domain");
    }
    fs::permissions(directory.path(), fs::perms(0755));
    fs::permissions(directory / "state", fs::perms(0777));
    fs::permissions(path, fs::perms(0444));
    TempDirectory reports;
    fs::permissions(reports.path(), fs::perms(0777));
    int status = statusOf(forked([&] { // root would have the right to write whatever the mode
        if (::geteuid() == 0 && (::setegid(65534) != 0 || ::seteuid(65534) != 0)) return 90;
        Preferences reader(path, 0.05);
        if (!(reader.get("domain", "key") == Value(1))) return 91;
        reader.set("domain", "key", 2);
        std::ofstream(reports / "complaint") << complaintOf([&] { reader.synchronize("domain"); });
        return 0;
    }));
    EXPECT_EQ(status, 0);
    std::string complaint = readFile(reports / "complaint");
    EXPECT_NE(complaint.find("read-only"), std::string::npos) << complaint;
    EXPECT_NE(complaint.find(path), std::string::npos) << complaint;
    fs::permissions(path, fs::perms(0600));
    EXPECT_EQ(preferences.get("domain", "key"), Value(1));
    store("key", 3);
    EXPECT_EQ(preferences.get("domain", "key"), Value(3)) << "with the right given, writing goes on";
}

TEST_F(PreferencesOf, WhenThereIsNoRoomTheFileStaysWholeAndTheChangeIsKept) {
    store("key", 1);
    TempDirectory reports;
    EXPECT_EQ(statusOf(forked([&] {
                  ::signal(SIGXFSZ, SIG_IGN);
                  rlimit limit{200'000, 200'000};
                  ::setrlimit(RLIMIT_FSIZE, &limit);
                  Preferences writer(path, 0.05);
                  writer.set("domain", "key", 2);
                  writer.set("domain", "big", Bytes(1'000'000));
                  std::string complaint = complaintOf([&] { writer.synchronize("domain"); });
                  std::ofstream(reports / "complaint") << complaint;
                  bool kept =
                      writer.get("domain", "key") == Value(2) && Preferences(path).get("domain", "key") == Value(1);
                  writer.remove("domain", "big");
                  writer.synchronize("domain");
                  return kept ? 0 : 91;
              })),
              0);
    std::string complaint = readFile(reports / "complaint");
    EXPECT_NE(complaint.find("room on its file system"), std::string::npos) << complaint;
    EXPECT_NE(complaint.find(path), std::string::npos) << complaint;
    EXPECT_EQ(preferences.get("domain", "key"), Value(2)) << "the smaller change went in with the next attempt";
    EXPECT_EQ(sqlite("PRAGMA integrity_check"), "ok\n");
}

TEST_F(PreferencesOf, ADirectoryInPlaceOfTheFileIsReported) {
    fs::create_directories(path);
    preferences.set("domain", "key", 1);
    expectComplaint([&] { preferences.synchronize("domain"); }, {"cannot be opened"});
}

TEST_F(PreferencesOf, AFileThatIsRemovedWhileInUseIsMadeAnewByTheNextWrite) {
    store("old", 1);
    for (const char* suffix : {"", "-wal", "-shm"}) fs::remove(path + suffix);
    EXPECT_TRUE(preferences.get("domain", "old").isAbsent());
    store("new", 2);
    EXPECT_EQ(Preferences(path).keys("domain"), (std::vector<std::string>{"new"}));
}

TEST_F(PreferencesOf, AFileThatIsReplacedWhileInUseIsTheOneThatCounts) {
    store("old", 1);
    fs::create_directories(directory / "backup");
    Preferences successor(directory / "backup/preferences.db");
    successor.set("domain", "restored", 1);
    successor.synchronize("domain");
    for (const char* suffix : {"", "-wal", "-shm"}) fs::remove(path + suffix);
    for (const char* suffix : {"-shm", "-wal", ""})
        fs::rename(directory / "backup/preferences.db" + suffix, path + suffix);
    EXPECT_EQ(preferences.keys("domain"), (std::vector<std::string>{"restored"}));
    store("added", 2);
    EXPECT_EQ(sqlite("SELECT key FROM preferences ORDER BY key"), "added\nrestored\n");
}

TEST_F(PreferencesOf, EightProcessesThatMakeAndWriteTheFileTogetherLoseNothing) {
    std::vector<pid_t> children;
    for (int child = 0; child < 8; ++child)
        children.push_back(forked([&, child] {
            Preferences own(path, 30);
            for (int i = 0; i < 10; ++i) {
                own.set("domain", std::to_string(child) + "." + std::to_string(i), i);
                own.synchronize("domain");
            }
            return 0;
        }));
    for (pid_t child : children) EXPECT_EQ(statusOf(child), 0);
    EXPECT_EQ(preferences.keys("domain").size(), 80u);
    EXPECT_EQ(sqlite("PRAGMA integrity_check"), "ok\n");
}

TEST_F(PreferencesOf, AProcessThatIsKilledWhileWritingLeavesAWholeTransactionAndNothingThatWasSynchronisedIsLost) {
    store("first", 0);
    store("second", 0);
    for (int kill = 0; kill < 12; ++kill) {
        int reports[2];
        ASSERT_EQ(::pipe2(reports, O_CLOEXEC), 0);
        int64_t start = preferences.get("domain", "first").integer();
        pid_t child = forked([&] {
            Preferences own(path, 30);
            for (int64_t i = start + 1;; ++i) {
                own.set("domain", "first", i);
                own.set("domain", "payload", Bytes(static_cast<size_t>(i % 7) * 20'000, static_cast<uint8_t>(i)));
                own.set("domain", "second", i);
                own.synchronize("domain");
                if (::write(reports[1], &i, sizeof i) != sizeof i) return 1;
            }
        });
        ::close(reports[1]);
        int64_t acknowledged = 0, more = 0;
        for (int i = 0; i <= kill % 4; ++i) ASSERT_EQ(::read(reports[0], &acknowledged, sizeof acknowledged), 8);
        ::kill(child, SIGKILL);
        EXPECT_EQ(statusOf(child), -SIGKILL);
        while (::read(reports[0], &more, sizeof more) == 8) acknowledged = more;
        ::close(reports[0]);
        int64_t first = preferences.get("domain", "first").integer();
        EXPECT_GE(first, acknowledged);
        EXPECT_LE(first, acknowledged + 1);
        EXPECT_EQ(preferences.get("domain", "second").integer(), first);
        EXPECT_EQ(preferences.get("domain", "payload").data(),
                  Bytes(static_cast<size_t>(first % 7) * 20'000, static_cast<uint8_t>(first)));
    }
    EXPECT_EQ(sqlite("PRAGMA integrity_check"), "ok\n");
}

TEST_F(PreferencesOf, ManyThreadsReadAndWriteOneObject) {
    std::vector<std::thread> threads;
    for (int t = 0; t < 6; ++t)
        threads.emplace_back([&, t] {
            std::string key = "key" + std::to_string(t);
            for (int i = 1; i <= 10; ++i) {
                preferences.set("domain", key, i);
                EXPECT_EQ(preferences.get("domain", key), Value(i));
                if (i % 5 == 0) preferences.synchronize("domain");
                (void)preferences.keys("domain");
            }
        });
    for (auto& thread : threads) thread.join();
    Preferences other(path);
    for (int t = 0; t < 6; ++t) EXPECT_EQ(other.get("domain", "key" + std::to_string(t)), Value(10));
}

TEST(SharedPreferences, LieInTheStateDirectoryAndFollowTheEnvironment) {
    std::string first;
    {
        TempHome home;
        first = Preferences::shared().path();
        EXPECT_EQ(first, home / "state/rolvane/preferences.db");
        Preferences::shared().set(kDaemonDomain, "CXDDebugLevel", 1);
        Preferences::shared().synchronize(kDaemonDomain);
        EXPECT_TRUE(fs::exists(first));
        EXPECT_EQ(&Preferences::shared(), &Preferences::shared());
    }
    TempHome home;
    EXPECT_NE(Preferences::shared().path(), first);
    EXPECT_TRUE(Preferences::shared().get(kDaemonDomain, "CXDDebugLevel").isAbsent());
}
