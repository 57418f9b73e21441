#include "KillRows.h"

namespace rolvane::board {

namespace {

constexpr size_t kMostOperations = 5000; // of a pass

Fault killAt(int64_t operation) {
    Fault fault;
    fault.kind = FaultControl::kill;
    fault.at = operation;
    fault.network = true;
    return fault;
}

} // namespace

bool killOnce(Work& work, const Scenario& scenario, size_t operation) {
    work.stage.forgetStory();
    work.stage.bringBack(scenario.name);
    const Ending ending = work.stage.pass(scenario.role, killAt(static_cast<int64_t>(operation)));
    if (ending.met == 0) return false;
    goOn(work, scenario, operation);
    judge(work, scenario.name + " killed at " + std::to_string(operation), settlingOf(scenario), ending);
    return true;
}

bool killWithNewOnes(Work& work, const Scenario& scenario, size_t operation, Behind behind) {
    constexpr size_t kNewOnes = 4;
    Stage& stage = work.stage;
    const std::string stamp = "new" + std::to_string(operation);
    const char itself = scenario.role;
    stage.forgetStory();
    stage.bringBack(scenario.name);
    const auto makes = [&](worlds::Editor& editor) { editor.makePeople(kNewOnes); };
    stage.edit(itself, makes, stamp);
    const Ending ending = stage.pass(itself, killAt(static_cast<int64_t>(operation)));
    if (ending.met == 0) return false;
    const auto goesOn = [&](worlds::Editor& editor) {
        behind == Behind::takesBack ? editor.takeBack(stamp) : editor.changePhoneOfThose(stamp);
    };
    stage.edit(itself, goesOn, "behind");
    judge(work, scenario.name + " with new contacts, killed at " + std::to_string(operation), settlingOf(scenario),
          ending);
    return true;
}

// A pass of each scenario is ended before each operation, and after each answer.
void killEverywhere(Work& work) {
    for (const Scenario& scenario : scenarios())
        for (size_t operation = 0; operation < kMostOperations; ++operation) {
            if (!work.isMine(operation)) continue;
            if (work.timeIsOver()) return;
            if (!killOnce(work, scenario, operation)) break;
        }
}

// And the pass that recovers from it is ended, too. Both moments are a matter of chance.
void killTwice(Work& work) {
    constexpr size_t kPairs = 500;
    for (size_t number = 0; number < kPairs; ++number) {
        if (!work.isMine(number)) continue;
        if (work.timeIsOver()) return;
        Stage& stage = work.stage;
        worlds::Chance chance(worlds::hashOf("pairs", stage.seed() * 10000 + number));
        const Scenario& scenario = chance.oneOf(scenarios());
        stage.forgetStory();
        stage.bringBack(scenario.name);
        const int64_t whole = stage.pass(scenario.role, killAt(INT32_MAX)).operations;
        stage.forgetStory();
        stage.bringBack(scenario.name);
        const auto first = static_cast<int64_t>(chance.below(static_cast<size_t>(whole)));
        (void)stage.pass(scenario.role, killAt(first));
        if (chance.happens(0.3)) goOn(work, scenario, number);
        const auto second = static_cast<int64_t>(chance.below(static_cast<size_t>(whole)));
        const Ending ending = stage.pass(scenario.role, killAt(second));
        goOn(work, scenario, number + kPairs);
        judge(work, scenario.name + " killed at " + std::to_string(first) + " and at " + std::to_string(second),
              settlingOf(scenario), ending);
    }
}

} // namespace rolvane::board
