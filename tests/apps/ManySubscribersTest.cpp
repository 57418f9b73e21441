#include "Neighbour.h"

#include <cstdlib>
#include <fstream>
#include <memory>
#include <vector>

namespace rolvane::test {
namespace {

// ROLVANE_TEST_SUBSCRIBERS makes it more (200: docs/performance.md).
int subscribers() {
    const char* text = std::getenv("ROLVANE_TEST_SUBSCRIBERS");
    return text ? std::atoi(text) : 40;
}

// Each of them has an account, a home and a daemon of their own, and all of them subscribe at the same time.
TEST(ManySubscribers, AllOfThemAreServedAtOnce) {
    CommandWorld world;
    world.bus();
    world.makeAccount();
    world.add("Ada");
    world.add("Bea");
    world.done({"publish"});
    std::vector<std::unique_ptr<Neighbour>> people;
    std::string grants;
    for (int i = 0; i < subscribers(); ++i) {
        people.push_back(std::make_unique<Neighbour>(world, "reader" + std::to_string(i), false));
        grants += "/Contacts r user reader" + std::to_string(i) + "\n";
    }
    // One list for all of them: forty commands of the publisher's are not what this is about.
    std::ofstream(world.store().stateDirectory() + "/lists/alice.acl") << "davacl 1\n" << grants << "end\n";
    std::vector<std::unique_ptr<ChildProcess>> commands;
    for (const auto& person : people) commands.push_back(person->startRolvane({"subscribe", "alice"}));
    for (size_t i = 0; i < commands.size(); ++i) {
        constexpr double kPatience = 200;
        const auto ending = commands[i]->wait(kPatience);
        ASSERT_TRUE(ending) << "reader" << i;
        EXPECT_TRUE(ending->exitedWith(kDone)) << "reader" << i << ": " << commands[i]->errors();
        EXPECT_EQ(people[i]->json({"list"}).size(), 2U) << "reader" << i;
    }
}

} // namespace
} // namespace rolvane::test
