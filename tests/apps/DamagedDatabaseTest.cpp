// A contact database that is damaged, empty or gone, met by the programs: nothing that it says then is carried
// anywhere.

#include "../contacts/DamagedIndex.h"
#include "Neighbour.h"

#include <filesystem>
#include <fstream>

namespace rolvane::test {
namespace {

bool tells(const Ran& ran, const std::string& part) {
    return ran.errors.find(part) != std::string::npos || ran.output.find(part) != std::string::npos;
}

// Alice has published three people and a group, and her daemon rests.
class DamagedFile : public testing::Test {
protected:
    DamagedFile() {
        world.bus();
        world.makeAccount();
        ada = world.add("Ada");
        world.add("Ben");
        world.add("Cleo");
        world.group("Friends", {"Ada", "Ben"});
        world.done({"publish"});
        world.done({"daemon", "stop"});
        published = world.tree();
        path = world.home / "data/rolvane/contacts.db";
    }
    // As it lies there, with what other processes may have left of it.
    void removeFile() {
        for (const char* of : {"", "-wal", "-shm"}) std::filesystem::remove(path + of);
    }
    void expectTheStoreIsAsItWas() { EXPECT_EQ(world.tree(), published); }
    // Each command that needs the database says it once, and ends with 1; no daemon does anything.
    void expectEverybodySays(const std::string& part, const std::string& toDo) {
        for (const std::vector<std::string>& command :
             {std::vector<std::string>{"list"}, {"add", "--first", "Dora"}, {"status"}, {"publish"}, {"sync"}}) {
            const Ran ran = world.rolvane(command);
            EXPECT_EQ(ran.status, kFailure) << command[0] << "\n" << ran;
            EXPECT_TRUE(tells(ran, part)) << command[0] << "\n" << ran;
            EXPECT_TRUE(tells(ran, toDo)) << command[0] << "\n" << ran;
        }
        const auto daemon = world.startManager();
        const auto end = daemon->wait();
        ASSERT_TRUE(end && end->signal == 0);
        EXPECT_NE(daemon->errors().find(part), std::string::npos) << daemon->errors();
        expectTheStoreIsAsItWas();
    }
    CommandWorld world;
    std::string ada, path;
    std::set<std::string> published;
};

TEST_F(DamagedFile, ThatIsEmptyIsNotTakenForANewOne) {
    removeFile();
    ASSERT_TRUE(std::ofstream(path));
    expectEverybodySays("empty", "new-database");
    EXPECT_EQ(std::filesystem::file_size(path), 0u) << "it stays as it is";
}

TEST_F(DamagedFile, ThatIsGoneIsNotReplacedWithoutAWord) {
    removeFile();
    expectEverybodySays("contacts.db", "new-database");
    EXPECT_FALSE(std::filesystem::exists(path));
}

TEST_F(DamagedFile, ABackupInItsPlaceGoesOnWhereItWas) {
    world.done({"list"}); // whoever opens it last brings the file up to date
    std::filesystem::copy_file(path, path + ".kept");
    removeFile();
    EXPECT_EQ(world.rolvane({"list"}).status, kFailure);
    std::filesystem::rename(path + ".kept", path);
    const Ran sync = world.rolvane({"sync"});
    EXPECT_TRUE(tells(sync, "Everything is up to date.")) << sync;
    expectTheStoreIsAsItWas();
}

TEST_F(DamagedFile, ANewDatabaseIsMadeOnPurposeAndDeletesNothingOnTheStore) {
    removeFile();
    const Ran unasked = world.rolvane({"new-database"}, "y\n");
    EXPECT_TRUE(saysOnce(unasked, kNotAllowed, "Begin with 0 contacts?")) << unasked;
    EXPECT_FALSE(std::filesystem::exists(path));
    world.done({"new-database", "--yes"});
    EXPECT_EQ(world.json({"status"})["people"], 0);
    world.rolvane({"sync"});
    expectTheStoreIsAsItWas();
    const Ran again = world.rolvane({"new-database", "--yes"});
    EXPECT_EQ(again.status, kFailure) << "there is one now\n" << again;
}

// The scan does not find Ada by the index any more, and the reader keeps her.
TEST_F(DamagedFile, AnIndexThatHasLostAContactIsMendedAndNobodyLosesIt) {
    Neighbour bob(world, "bob");
    world.done({"share", "bob"});
    bob.done({"subscribe", "alice"});
    bob.done({"daemon", "stop"});
    world.done({"daemon", "stop"});
    loseInTheIndex(path, ada);
    world.done({"edit", "Cleo", "--note", "makes the scan look"});
    const auto daemon = world.startManager();
    EXPECT_TRUE(daemon->waitForLine("was damaged. Its indexes have been rebuilt")) << daemon->errors();
    const Ran sync = world.rolvane({"sync"});
    EXPECT_TRUE(tells(sync, "Everything is up to date.")) << sync;
    expectTheStoreIsAsItWas();
    EXPECT_EQ(world.json({"status"})["people"], 3);
    EXPECT_TRUE(world.json({"status"})["damaged"].is_null());
    bob.done({"sync"});
    EXPECT_EQ(bob.json({"list"}).size(), 3u);
    EXPECT_EQ(bob.json({"withdrawn", "list"}).size(), 0u);
}

} // namespace
} // namespace rolvane::test
