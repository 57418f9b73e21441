#include "Neighbour.h"
#include "TerminalSession.h"

#include <filesystem>
#include <fstream>
#include <map>
#include <sqlite3.h>

namespace rolvane::test {
namespace {

namespace fs = std::filesystem;

// What stands in a database's log goes into its file.
void settle(const std::string& path) {
    sqlite3* database = nullptr;
    ASSERT_EQ(sqlite3_open_v2(path.c_str(), &database, SQLITE_OPEN_READWRITE, nullptr), SQLITE_OK);
    EXPECT_EQ(sqlite3_exec(database, "PRAGMA wal_checkpoint(TRUNCATE)", nullptr, nullptr, nullptr), SQLITE_OK);
    sqlite3_close(database);
}

bool isDatabase(const std::string& path) {
    return contentsOf(path).starts_with("SQLite format 3");
}

// A server's notes about requests: its logs, and its journal of changes. A mere question brings that up to date, and a
// request whose client is gone may still write it.
bool isNoteOfServer(const std::string& path) {
    return path.find("/logs/") != std::string::npos || path.find(".sync/") != std::string::npos ||
           path.ends_with("_log") || path.ends_with(".log");
}

// Every file below a directory, with its bytes, but a server's notes.
std::map<std::string, std::string> bytesBelow(const std::string& directory) {
    std::map<std::string, std::string> files;
    std::vector<std::string> databases;
    for (const auto& entry : fs::recursive_directory_iterator(directory))
        if (entry.is_regular_file() && isDatabase(entry.path())) databases.push_back(entry.path());
    for (const std::string& database : databases) settle(database);
    for (const auto& entry : fs::recursive_directory_iterator(directory)) {
        const std::string path = entry.path();
        if (!entry.is_regular_file() || isNoteOfServer(path) || path.ends_with("-shm") ||
            (path.ends_with("-wal") && entry.file_size() == 0))
            continue;
        files[path] = contentsOf(path);
    }
    return files;
}

std::string difference(const std::map<std::string, std::string>& before,
                       const std::map<std::string, std::string>& after) {
    std::string text;
    for (const auto& [path, bytes] : before)
        if (!after.contains(path))
            text += "gone: " + path + "\n";
        else if (after.at(path) != bytes)
            text += "changed: " + path + "\n";
    for (const auto& [path, bytes] : after)
        if (!before.contains(path)) text += "new: " + path + "\n";
    return text;
}

struct Plan : testing::Test {
    CommandWorld world;
    Neighbour bob{world, "bob"};
    Plan() {
        world.makeAccount();
        world.add("Ada", {"--email", "home:ada@example.org"});
        world.add("Cleo");
        world.group("Family", {"Ada"});
    }
    // The daemon ends behind a whole pass, so that no request of it is left on its way to the store.
    void rest() {
        world.done({"sync"});
        world.done({"daemon", "stop"});
    }
    // Of home and store, while no daemon runs.
    std::map<std::string, std::string> everything() {
        auto files = bytesBelow(world.home.path());
        files.merge(bytesBelow(fs::path(world.treeDirectory()).parent_path().parent_path()));
        return files;
    }
    // The command's talk in a pipe; neither that nor a terminal changes a byte.
    std::string tried(std::vector<std::string> command) {
        std::string line = quotedForShell(UserWorld::rolvaneProgram());
        for (const std::string& word : command) line += " " + quotedForShell(word);
        const auto before = everything();
        EXPECT_FALSE(before.empty());
        const Ran ran = world.rolvane(command);
        EXPECT_EQ(ran.status, kDone) << ran;
        EXPECT_EQ(difference(before, everything()), "") << line;
        TerminalSession session(line, world.home.environment());
        EXPECT_EQ(session.end(), kDone) << session.shown();
        EXPECT_EQ(difference(before, everything()), "") << line << " at a terminal";
        EXPECT_FALSE(world.daemon());
        return ran.output + ran.errors;
    }
};

TEST_F(Plan, TellsWhatWouldBePublishedAndChangesNoByte) {
    EXPECT_NE(tried({"plan"}).find("nothing is published"), std::string::npos);
    EXPECT_NE(tried({"publish", "--dry-run"}).find("2 people and 1 group would go to"), std::string::npos);
    world.done({"publish", "--group", "Family"});
    world.done({"share", "bob"});
    rest();
    EXPECT_NE(tried({"publish", "--dry-run"}).find("1 person would go to"), std::string::npos);
    EXPECT_NE(tried({"publish", "--dry-run"}).find("readable for 1 user (bob)"), std::string::npos);
    EXPECT_NE(tried({"publish", "--group", "Family", "--dry-run"}).find("is published already"), std::string::npos);
    const auto told = world.json({"publish", "--dry-run"});
    EXPECT_EQ(told["people"], 1);
    EXPECT_EQ(told["users"], nlohmann::json::array({"bob"}));
}

TEST_F(Plan, TellsWhoWouldReadAndWhatWouldLeave) {
    world.done({"publish"});
    rest();
    EXPECT_NE(tried({"share", "bob", "--dry-run"}).find("2 people and 1 group would become readable for \"bob\"."),
              std::string::npos);
    EXPECT_NE(tried({"share", "bob", "--write", "--dry-run"}).find("readable and changeable"), std::string::npos);
    EXPECT_NE(
        tried({"unpublish", "--dry-run"}).find("2 people and 1 group would leave the store. You share with nobody"),
        std::string::npos);
    world.done({"share", "bob", "--write"});
    rest();
    EXPECT_NE(tried({"share", "bob", "--write", "--dry-run"}).find("may do so already"), std::string::npos);
    EXPECT_NE(tried({"share", "bob", "--dry-run"}).find("would no longer be changeable for"), std::string::npos);
    EXPECT_NE(tried({"unpublish", "--dry-run"}).find("where 1 user (bob) could read them"), std::string::npos);
    EXPECT_EQ(world.json({"shares"})[0]["rights"], "write");
}

TEST_F(Plan, TellsWhatWouldComeFromAnother) {
    bob.done({"add", "--first", "Bea"});
    bob.done({"add", "--first", "Ben"});
    bob.done({"group", "create", "Work", "Bea"});
    bob.done({"publish"});
    bob.done({"share", "alice"});
    bob.done({"daemon", "stop"});
    EXPECT_NE(tried({"subscribe", "bob", "--dry-run"}).find("2 people and 1 group of \"bob\" would come"),
              std::string::npos);
    EXPECT_EQ(world.json({"subscriptions"}), nlohmann::json::array());
    EXPECT_TRUE(saysOnce(world.rolvane({"subscribe", "cid", "--dry-run"}), kNotAllowed, "\"cid\""));
}

TEST_F(Plan, TellsWhatWouldBeImportedAndMerged) {
    world.done({"publish"});
    world.done({"share", "bob"});
    rest();
    const std::string file = world.write("new.vcf", "BEGIN:VCARD\r\nVERSION:3.0\r\nN:;Dora;;;\r\nFN:Dora\r\nUID:d\r\n"
                                                    "END:VCARD\r\n");
    EXPECT_NE(tried({"import", file, "--dry-run"}).find("1 person would become readable for 1 user (bob)"),
              std::string::npos);
    EXPECT_NE(tried({"merge", "Ada", "Cleo", "--dry-run"}).find("this was a trial"), std::string::npos);
    EXPECT_EQ(world.json({"list"}).size(), 2U);
}

TEST_F(Plan, CountsWhatTheDaemonHasNotSeen) {
    world.done({"publish"});
    rest();
    EXPECT_NE(tried({"plan"}).find("no new edit since the daemon looked last"), std::string::npos);
    const auto before = everything();
    world.add("Dora");
    EXPECT_NE(difference(before, everything()), "") << "a change would show";
    world.done({"edit", "Ada", "--note", "x"});
    world.done({"edit", "Dora", "--note", "x"});
    world.done({"delete", "Cleo", "--yes"});
    world.add("Gone");
    world.done({"delete", "Gone", "--yes"});
    const std::string told = tried({"plan"});
    EXPECT_NE(told.find("1 added, 1 changed, 1 deleted since the daemon looked last"), std::string::npos) << told;
    EXPECT_EQ(world.json({"plan"})["own"]["unseen"]["deleted"], 1);
    rest();
    EXPECT_NE(tried({"plan"}).find("no new edit"), std::string::npos);
}

} // namespace
} // namespace rolvane::test
