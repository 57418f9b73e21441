// Passes of a subscriber's daemon that are killed.

#include "TwoPeople.h"

#include <chrono>

namespace rolvane::test {
namespace {

constexpr double kPatience = 60; // seconds for one pass, on a loaded machine

class KilledSubscriber : public TwoPeople {
protected:
    KilledSubscriber() : TwoPeople(120) { bobsProgram->done({"subscribe", "alice", "--no-daemon"}); }

    void deleteAndAdd(int round) {
        const size_t gone = random() % people.size();
        alice->removeRecord(personOf(*alice, gone));
        people.erase(people.begin() + static_cast<std::ptrdiff_t>(gone));
        auto person = CXPerson::create();
        const std::string name = "New " + std::to_string(round);
        person->setValue(Value(name), kCXFirstNameProperty);
        alice->addRecord(person);
        people.push_back(person->uniqueId());
        written[person->uniqueId().str()].insert(name);
        groupOf(*alice, random() % kGroups)->addMember(person);
        alice->save();
    }

    std::string cleanPass() {
        const auto daemon = bobsProgram->startManager({"-p"});
        const auto ending = daemon->wait(kPatience);
        EXPECT_TRUE(ending && ending->exitedWith(0)) << daemon->errors();
        return daemon->errors();
    }
};

TEST_F(KilledSubscriber, AtAnyMomentOfAPassLosesNothingAndDoublesNothingAfterCleanPasses) {
    constexpr int kKills = 30, kEditsBetween = 4;
    double whole = 0.4; // seconds that a pass takes, about
    int inTheMiddle = 0;
    for (int kill = 0; kill < kKills; ++kill) {
        for (int i = 0; i < kEditsBetween; ++i) edit(*alice, "alice", kill * kEditsBetween + i);
        if (kill % 3 == 0) deleteAndAdd(kill);
        if (kill % 4 == 1) edit(*bob, "bob", kill);
        const auto daemon = bobsProgram->startManager({"-p"});
        const auto start = std::chrono::steady_clock::now();
        const double moment = std::uniform_real_distribution<double>(0, whole)(random);
        if (daemon->wait(moment)) {
            whole = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
            continue;
        }
        daemon->kill();
        ++inTheMiddle;
    }
    EXPECT_GE(inTheMiddle, kKills / 2) << "the passes were faster than the kills";

    cleanPass();          // gives back the lock that a killed one has left on her tree
    world.done({"sync"}); // all of hers is on the store
    const std::string said = cleanPass();
    expectEqual(storeView(), view(*bob), "bob's database\n" + said);
    expectEverySurvivingNameWasWritten(*bob);
    world.done({"sync"});
    expectEqual(storeView(), view(*alice), "alice's database");
    for (const auto& [name, text] : view(*bob)) EXPECT_EQ(text.find("twice"), std::string::npos) << name << text;
}

} // namespace
} // namespace rolvane::test
