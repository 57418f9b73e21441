#include "Neighbour.h"

#include <chrono>
#include <nlohmann/json.hpp>

// What somebody else has changed is there without `rolvane sync`, long before the daemon would look by itself.

namespace rolvane::test {
namespace {

constexpr double kWhole = 120; // seconds that it may take on a loaded machine; the daemon's own look comes after 300

class NewsTravel : public testing::Test {
protected:
    NewsTravel() {
        world.home.setVariable("ROLVANE_NEWS", std::nullopt);
        world.bus();
        world.makeAccount();
    }
    bool hasNote(Neighbour& who, const std::string& note) {
        const auto deadline = std::chrono::steady_clock::now() + std::chrono::duration<double>(kWhole);
        while (std::chrono::steady_clock::now() < deadline)
            if (who.done({"list", "--of", "alice", "--json", "--full"}).find(note) != std::string::npos) return true;
        return false;
    }
    CommandWorld world;
};

TEST_F(NewsTravel, FromTheOwnersEditToTheReadersDatabaseWithoutSync) {
    world.add("Ada");
    world.done({"publish"});
    Neighbour bob(world, "bob");
    world.done({"share", "bob"});
    bob.done({"subscribe", "alice"});
    world.done({"edit", "Ada", "--note", "the first news"});
    EXPECT_TRUE(hasNote(bob, "the first news"));
    world.done({"edit", "Ada", "--note", "the second news"});
    EXPECT_TRUE(hasNote(bob, "the second news"));
    // The store starts anew: the request is made again, and tells what has come meanwhile.
    world.store().stop(PrivateStore::Stop::atOnce);
    world.store().start();
    world.done({"edit", "Ada", "--note", "the third news"});
    EXPECT_TRUE(hasNote(bob, "the third news"));
}

} // namespace
} // namespace rolvane::test
