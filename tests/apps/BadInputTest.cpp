#include "CommandWorld.h"

#include <filesystem>
#include <fstream>
#include <set>
#include <sqlite3.h>
#include <sys/stat.h>

namespace rolvane::test {
namespace {

namespace fs = std::filesystem;

class BadInput : public testing::Test {
protected:
    std::string database() const { return world.home / "data/rolvane/contacts.db"; }
    std::string preferences() const { return world.home / "state/rolvane/preferences.db"; }
    size_t people() { return world.json({"list"}).size(); }
    // The contact application with files of at most so many blocks of 512 bytes: a disk that is full.
    Ran onAFullDisk(int blocks, std::vector<std::string> arguments) {
        std::vector<std::string> command{"/bin/sh", "-c",
                                         "trap '' XFSZ; ulimit -f " + std::to_string(blocks) + "; exec \"$0\" \"$@\"",
                                         UserWorld::rolvaneProgram()};
        command.insert(command.end(), arguments.begin(), arguments.end());
        return world.run(command);
    }
    // Without root's right to write everywhere, should the tests have it.
    Ran withoutPrivileges(std::vector<std::string> arguments) {
        std::vector<std::string> command;
        if (::geteuid() == 0) command = {"setpriv", "--bounding-set=-all", "--inh-caps=-all"};
        command.push_back(UserWorld::rolvaneProgram());
        command.insert(command.end(), arguments.begin(), arguments.end());
        return world.run(command);
    }
    CommandWorld world;
};

constexpr const char* kGoodCard = "BEGIN:VCARD\r\nVERSION:4.0\r\nFN:Good Card\r\nN:Card;Good;;;\r\nEND:VCARD\r\n";

TEST_F(BadInput, EachBrokenCardOrLineIsNamedWithFileLineAndReasonAndTheGoodOnesGoIn) {
    // Files whose damage costs no card: the line is kept, or the text is read with the character set that it is of.
    const std::set<std::string> whole{"bad-base64.vcf", "damaged-value.vcf", "latin-1.vcf", "no-colon.vcf",
                                      "nul-byte.vcf",   "open-quote.vcf",    "utf-16.vcf"};
    size_t files = 0;
    for (const auto& entry : fs::directory_iterator(ROLVANE_SOURCE_DIR "/share/demo/broken")) {
        ++files;
        CommandWorld other;
        const std::string good = other.write("good.vcf", kGoodCard);
        const bool goesIn = whole.contains(entry.path().filename());
        const auto report = other.json({"import", entry.path().string(), good, "-q"}, goesIn ? kDone : kPart);
        EXPECT_EQ(report["errors"].empty(), goesIn) << entry.path();
        auto named = report["errors"];
        for (const auto& notice : report["notices"]) named.push_back(notice);
        EXPECT_GE(named.size() + report["charsets"].size(), 1U) << entry.path();
        for (const auto& error : named) {
            EXPECT_EQ(error["file"], entry.path().string());
            EXPECT_GE(error["line"].get<int>(), 1);
            EXPECT_NE(error["reason"], "");
        }
        EXPECT_EQ(other.json({"list", "Good Card"}).size(), 1U) << entry.path();
    }
    EXPECT_GE(files, 10U);
}

TEST_F(BadInput, OnlyBadCardsAreAFailureAndNotAPart) {
    const std::string file = world.write("bad.vcf", "BEGIN:VCARD\r\nVERSION:4.0\r\nEND:VCARD\r\n");
    const Ran ran = world.rolvane({"import", "-q", file});
    EXPECT_EQ(ran.status, kFailure) << ran;
    EXPECT_EQ(lineCount(ran.errors), 1U) << ran;
    EXPECT_TRUE(ran.errors.starts_with(file + ":1: ")) << ran;
}

TEST_F(BadInput, ADirectoryOrAMissingFileIsNamedAndTheOtherFilesGoIn) {
    EXPECT_TRUE(saysOnce(world.rolvane({"import", "-q", world.home.path()}), kFailure, "is a directory"));
    EXPECT_TRUE(saysOnce(world.rolvane({"import", "-q", world.home / "missing.vcf"}), kFailure, "missing.vcf"));
    const std::string good = world.write("good.vcf", kGoodCard);
    EXPECT_TRUE(saysOnce(world.rolvane({"import", "-q", world.home / "missing.vcf", good}), kPart, "missing.vcf"));
    EXPECT_EQ(people(), 1U);
}

TEST_F(BadInput, StandardInputIsImportedToo) {
    EXPECT_EQ(world.json({"import", "-"}, kDone, kGoodCard)["imported"], 1);
    const Ran bad = world.rolvane({"import", "-q", "-"}, "no card at all\r\n");
    EXPECT_EQ(bad.status, kFailure) << bad;
    EXPECT_TRUE(bad.errors.starts_with("standard input:1: ")) << bad;
}

// A pipe has neither a length nor a second reading: what kind of file it is has to be told from what has come.
TEST_F(BadInput, TablesComeThroughAPipeToo) {
    std::string csv = "First Name,Last Name,E-mail Address,Notes\n";
    for (int i = 0; i < 3000; ++i)
        csv += "Ann" + std::to_string(i) + ",Byron,a" + std::to_string(i) + "@example.org,\"two\nlines, and " +
               std::string(60, 'x') + "\"\n";
    const std::string file = world.write("people.csv", csv);
    const std::string rolvane = "'" + UserWorld::rolvaneProgram() + "' import -q --json ";
    // In two pieces, the first of which ends within a line.
    const Ran piped =
        world.run({"sh", "-c", "{ head -c 70001 '" + file + "'; tail -c +70002 '" + file + "'; } | " + rolvane + "-"});
    ASSERT_EQ(piped.status, kDone) << piped;
    EXPECT_EQ(nlohmann::json::parse(piped.output)["imported"], 3000) << piped;
    const std::string fifo = "'" + (world.home / "fifo.csv") + "'";
    const Ran named =
        world.run({"sh", "-c", "mkfifo " + fifo + " && { cat '" + file + "' > " + fifo + " & } && " + rolvane + fifo});
    ASSERT_EQ(named.status, kDone) << named;
    EXPECT_EQ(nlohmann::json::parse(named.output)["imported"], 0) << named;
    EXPECT_EQ(nlohmann::json::parse(named.output)["unchanged"], 3000) << named;
    const Ran ldif = world.run(
        {"sh", "-c",
         "printf 'dn: cn=Grace\\nobjectclass: person\\ncn: Grace Hopper\\nsn: Hopper\\nmail: g@example.org\\n' | " +
             rolvane + "-"});
    ASSERT_EQ(ldif.status, kDone) << ldif;
    EXPECT_EQ(nlohmann::json::parse(ldif.output)["imported"], 1) << ldif;
}

TEST_F(BadInput, AHundredMegabytesOfOneLineAreLeftOutAndTheirCardGoesIn) {
    const std::string path = world.home / "endless.vcf";
    {
        std::ofstream file(path, std::ios::binary);
        file << "BEGIN:VCARD\r\nVERSION:4.0\r\nFN:Endless\r\nNOTE:";
        const std::string piece(1 << 20, 'x');
        for (int i = 0; i < 100; ++i) file << piece;
        file << "\r\nEND:VCARD\r\n" << kGoodCard;
    }
    const auto report = world.json({"import", "-q", path}, kPart);
    ASSERT_EQ(report["notices"].size(), 1U) << report.dump(1);
    EXPECT_EQ(report["notices"][0]["line"], 4);
    EXPECT_EQ(report["linesLost"], 1);
    EXPECT_EQ(report["imported"], 2);
    EXPECT_EQ(world.json({"list", "Good Card"}).size(), 1U);
}

TEST_F(BadInput, ALineThatNeverEndsIsRefused) {
    const std::string path = world.home / "endless.vcf";
    {
        std::ofstream file(path, std::ios::binary);
        file << kGoodCard << "BEGIN:VCARD\r\nVERSION:4.0\r\nFN:Endless\r\nNOTE:";
        const std::string piece(1 << 20, 'x');
        for (int i = 0; i < 40; ++i) file << piece;
    }
    const auto report = world.json({"import", "-q", path}, kPart);
    EXPECT_GE(report["errors"].size(), 1U);
    EXPECT_EQ(report["imported"], 1);
}

TEST_F(BadInput, AFullDiskStopsAnImportInOneLineAndNothingStoredIsLost) {
    world.add("Before");
    const Ran ran = onAFullDisk(80, {"import", "-q", ROLVANE_SOURCE_DIR "/share/demo/people.vcf"});
    EXPECT_TRUE(saysOnce(ran, kFailure, "no room"));
    EXPECT_EQ(world.json({"list", "Before"}).size(), 1U);
    EXPECT_EQ(world.json({"import", "-q", ROLVANE_SOURCE_DIR "/share/demo/people.vcf"})["bad"], 0);
    EXPECT_GE(people(), 300U);
}

TEST_F(BadInput, AReadOnlyDatabaseIsSaidToBeOneAndIsNotChanged) {
    world.add("Ada");
    const std::string before = contentsOf(database());
    ::chmod(database().c_str(), 0400);
    ::chmod((world.home / "data/rolvane").c_str(), 0500);
    for (const auto& command : std::vector<std::vector<std::string>>{
             {"add", "--first", "Bob"}, {"edit", "Ada", "--note", "x"}, {"delete", "Ada", "--yes"}}) {
        const Ran ran = withoutPrivileges(command);
        EXPECT_TRUE(saysOnce(ran, kFailure, database()));
        EXPECT_TRUE(saysOnce(ran, kFailure, "Check the permissions"));
    }
    ::chmod((world.home / "data/rolvane").c_str(), 0700);
    ::chmod(database().c_str(), 0600);
    EXPECT_EQ(contentsOf(database()), before);
    EXPECT_EQ(people(), 1U);
}

TEST_F(BadInput, ALockedDatabaseIsWaitedForAWhileThenNothingIsLost) {
    world.add("Ada");
    sqlite3* other = nullptr;
    ASSERT_EQ(sqlite3_open(database().c_str(), &other), SQLITE_OK);
    ASSERT_EQ(sqlite3_exec(other, "BEGIN IMMEDIATE", nullptr, nullptr, nullptr), SQLITE_OK);
    EXPECT_EQ(people(), 1U) << "reading needs no lock";
    EXPECT_TRUE(saysOnce(world.rolvane({"add", "--first", "Bob"}), kFailure, "locked"));
    sqlite3_close(other);
    EXPECT_EQ(people(), 1U);
    world.add("Bob");
    EXPECT_EQ(people(), 2U);
}

TEST_F(BadInput, ADamagedDatabaseIsLeftAsItIs) {
    world.add("Ada");
    const std::string garbage = "this is no database, and has never been one, however long one looks at it";
    for (const char* suffix : {"-wal", "-shm"}) fs::remove(database() + suffix);
    std::ofstream(database()) << garbage;
    for (const auto& command : std::vector<std::vector<std::string>>{{"list"}, {"add", "--first", "Bob"}, {"status"}})
        EXPECT_TRUE(saysOnce(world.rolvane(command), kFailure, database()));
    EXPECT_TRUE(saysOnce(world.rolvane({"daemon", "start"}), kFailure, database())) << "its last words";
    EXPECT_FALSE(world.daemon());
    EXPECT_EQ(contentsOf(database()), garbage);
}

TEST_F(BadInput, DamagedPreferencesAreLeftAsTheyAre) {
    world.add("Ada");
    const std::string garbage = "these are no preferences, and have never been any, however long one looks at them";
    fs::create_directories(world.home / "state/rolvane");
    std::ofstream(preferences()) << garbage;
    for (const auto& command : std::vector<std::vector<std::string>>{
             {"defaults", "read"}, {"defaults", "write", "a", "b"}, {"status"}, {"daemon", "start"}})
        EXPECT_TRUE(saysOnce(world.rolvane(command), kFailure, preferences()));
    EXPECT_EQ(contentsOf(preferences()), garbage);
    EXPECT_EQ(people(), 1U) << "contacts do not need them";
}

TEST_F(BadInput, ADamagedAccountCanOnlyBeReplacedWhole) {
    fs::create_directories(world.home / "config/rolvane");
    const std::string path = world.write("config/rolvane/account.plist", "garbage");
    for (const auto& command :
         std::vector<std::vector<std::string>>{{"account", "show"}, {"account", "test"}, {"publish"}})
        EXPECT_TRUE(saysOnce(world.rolvane(command), kFailure, path));
    EXPECT_TRUE(saysOnce(world.rolvane({"account", "set", "--user", "x"}), kFailure, "--endpoint"));
    EXPECT_EQ(contentsOf(path), "garbage");
    world.done(
        {"account", "set", "--user", "x", "--endpoint", "https://dav.example.org/{user}/Contacts", "--no-password"});
    EXPECT_EQ(world.json({"account", "show"})["user"], "x");
}

} // namespace
} // namespace rolvane::test
