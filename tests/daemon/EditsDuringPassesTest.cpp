#include "DaemonWorld.h"

#include "foundation/Paths.h"

#include <fstream>
#include <map>
#include <random>

namespace rolvane::test {
namespace {

constexpr int kEdits = 300;
constexpr double kWhole = 60; // seconds that everything may take on a loaded machine

// Many people, published, and each edited once at a random moment by another process than the daemon.
class EditsDuringPasses : public testing::Test {
protected:
    EditsDuringPasses() {
        world.bus();
        world.addPeople(kEdits);
        world.saveAccountOn(world.store());
        world.publishEverything();
        for (const CXPersonRef& person : world.database().allGroup()->members()) people.push_back(person);
        std::shuffle(people.begin(), people.end(), random);
    }

    void edit(size_t i) {
        people[i]->setValue("Edited " + std::to_string(i), kCXFirstNameProperty);
        world.database().save();
    }
    // Successful writes by the file's name, as the server has logged them.
    std::map<std::string, int> writes() {
        std::map<std::string, int> counts;
        std::ifstream log(home() + "/logs/access.log");
        for (std::string line; std::getline(log, line);) {
            const bool put = line.find(" PUT 201 ") != std::string::npos || line.find(" PUT 204 ") != std::string::npos;
            if (put) ++counts[line.substr(line.rfind('/') + 1)];
        }
        return counts;
    }
    std::string home() { return world.home / "store"; }

    void expectEachExactlyOnce(const std::string& log) {
        EXPECT_EQ(world.differences(), "") << log;
        EXPECT_EQ(world.pendingChanges(), 0U) << log;
        const auto counts = writes();
        for (size_t i = 0; i < people.size(); ++i) {
            const auto found = counts.find(people[i]->uniqueId().str());
            ASSERT_NE(found, counts.end()) << people[i]->uniqueId().str();
            EXPECT_EQ(found->second, kPublication + 1) << "edit " << i;
        }
    }

    static constexpr int kPublication = 1; // each was written once before
    DaemonWorld world;
    std::vector<CXPersonRef> people;
    std::mt19937 random{20};
};

TEST_F(EditsDuringPasses, OfAResidentDaemonAreAllOnTheStoreInTheEndEachWrittenOnce) {
    const auto daemon = world.serving();
    const auto settled = [&] { return world.pendingChanges() == 0 && world.differences().empty(); };
    for (int i = 0; i < kWhole * 20 && !settled(); ++i) daemon->wait(0.05);
    ASSERT_EQ(world.differences(), "") << daemon->errors();
    std::vector<std::unique_ptr<ChildProcess>> passes;
    for (size_t i = 0; i < people.size(); ++i) {
        if (i % 30 == 0) passes.push_back(world.startRolvane({"sync"})); // a whole pass beside the edits
        edit(i);
        if (random() % 4 == 0) daemon->wait(static_cast<double>(random() % 20) / 1000);
    }
    for (const auto& pass : passes) EXPECT_TRUE(pass->wait());
    for (int i = 0; i < kWhole * 20 && !settled(); ++i) daemon->wait(0.05);
    expectEachExactlyOnce(daemon->errors());
}

TEST_F(EditsDuringPasses, OfADaemonThatMakesOnePassAndEndsAreAllOnTheStoreAfterTheNextEachWrittenOnce) {
    const auto first = world.startManager({"-p"});
    ASSERT_TRUE(first->wait(kWhole));
    ASSERT_EQ(world.differences(), "") << first->errors();
    std::unique_ptr<ChildProcess> daemon;
    for (size_t i = 0; i < people.size(); ++i) {
        if (!daemon || daemon->wait(0)) daemon = world.startManager({"-p"}); // as soon as one ends the next one starts
        edit(i);
        if (random() % 4 == 0) daemon->wait(static_cast<double>(random() % 20) / 1000);
    }
    ASSERT_TRUE(daemon->wait(kWhole));
    const auto last = world.startManager({"-p"});
    ASSERT_TRUE(last->wait(kWhole));
    expectEachExactlyOnce(last->errors());
}

} // namespace
} // namespace rolvane::test
