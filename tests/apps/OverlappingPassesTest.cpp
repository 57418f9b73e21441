// Passes of two people's daemons that run at the same time.

#include "TwoPeople.h"

namespace rolvane::test {
namespace {

constexpr double kPatience = 60; // seconds for one pass, on a loaded machine

class OverlappingPasses : public TwoPeople {
protected:
    OverlappingPasses() : TwoPeople(50) {
        bobsProgram->done({"subscribe", "alice"});
        expectEqual(view(*alice), view(*bob), "bob after he has subscribed");
    }
};

TEST_F(OverlappingPasses, OfTwoWritersEndWithEqualDatabasesAndStore) {
    constexpr int kEdits = 500, kPasses = 25; // a pass of each at the same time, every so many edits
    std::vector<std::unique_ptr<ChildProcess>> passes;
    for (int i = 0; i < kEdits; ++i) {
        if (i % kPasses == 0) {
            for (const auto& pass : passes) ASSERT_TRUE(pass->wait(kPatience)) << pass->errors();
            passes.clear();
            passes.push_back(world.startRolvane({"sync"}));
            passes.push_back(bobsProgram->startRolvane({"sync"}));
        }
        const bool isAlice = random() % 2 == 0;
        edit(isAlice ? *alice : *bob, isAlice ? "alice" : "bob", i);
    }
    for (const auto& pass : passes) ASSERT_TRUE(pass->wait(kPatience)) << pass->errors();
    for (int round = 0; round < 2; ++round) {
        world.done({"sync"});
        bobsProgram->done({"sync"});
    }
    const auto hers = view(*alice);
    expectEqual(hers, view(*bob), "bob's database");
    expectEqual(hers, storeView(), "the store");
    expectEverySurvivingNameWasWritten(*alice);
    for (const auto& [name, text] : hers) EXPECT_EQ(text.find("twice"), std::string::npos) << name << text;
}

} // namespace
} // namespace rolvane::test
