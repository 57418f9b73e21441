#include "Board.h"

namespace rolvane::board {

namespace {

// Much in one save, and everything that can be done.
worlds::Habits busy() {
    worlds::Habits habits;
    habits.most = 10;
    habits.remove = 10;
    habits.makeGroup = 8;
    habits.removeGroup = 5;
    habits.turn = 0;
    habits.leaveOne = true;
    return habits;
}

// What was just made goes again.
worlds::Habits takingBack() {
    worlds::Habits habits = busy();
    habits.remove = habits.leave = 30;
    habits.removeGroup = 15;
    return habits;
}

} // namespace

const std::vector<Scenario>& scenarios() {
    static const std::vector<Scenario> all{{"owner-first", 'o', true},   {"writer-first", 'w', false},
                                           {"reader-first", 'r', false}, {"owner-later", 'o', false},
                                           {"writer-later", 'w', false}, {"reader-later", 'r', false}};
    return all;
}

void makeScenarios(Stage& stage) {
    const auto inStep = [&] {
        for (const char role : {'o', 'w', 'r', 'o'}) (void)stage.pass(role);
    };
    stage.keep("owner-first");
    (void)stage.pass('o');
    for (const char role : {'w', 'r'}) (void)stage.command(role, {"subscribe", stage.userOf('o'), "--no-daemon"});
    stage.keep("writer-first");
    stage.keep("reader-first");
    inStep();
    stage.keep("in-step");
    stage.edit('w', busy(), "1");
    (void)stage.pass('w');
    stage.edit('o', busy(), "2");
    stage.edit('o', busy(), "3");
    stage.keep("owner-later");
    inStep();
    stage.edit('w', busy(), "4");
    (void)stage.pass('w');
    stage.edit('o', busy(), "5");
    (void)stage.pass('o');
    stage.keep("reader-later");
    (void)stage.pass('r');
    stage.edit('o', busy(), "6");
    (void)stage.pass('o');
    stage.edit('w', busy(), "7");
    stage.edit('w', busy(), "8");
    stage.keep("writer-later");
}

Settling settlingOf(const Scenario& scenario) {
    Settling settling;
    settling.first = scenario.role;
    settling.subscribes = scenario.alone;
    return settling;
}

void goOn(Work& work, const Scenario& scenario, size_t number) {
    if (!work.goesOn) return;
    Stage& stage = work.stage;
    const char harmed = scenario.role, itself = harmed == 'r' ? 'o' : harmed, other = harmed == 'o' ? 'w' : 'o';
    const std::string stamp = "n" + std::to_string(number);
    switch (worlds::hashOf("go on " + scenario.name, stage.seed() * 1000 + number) % 4) {
    case 0: return;
    case 1: stage.edit(itself, busy(), stamp); break;
    case 2: stage.edit(itself, takingBack(), stamp); break;
    default:
        if (scenario.alone) return;
        stage.edit(other, takingBack(), stamp);
        (void)stage.pass(other);
        return;
    }
    if (itself != harmed) (void)stage.pass(itself);
}

bool judge(Work& work, const std::string& name, const Settling& settling, const Ending& harmed) {
    Verdict verdict = settleAndJudge(work.stage, settling);
    if (harmed.late) verdict.wrong.push_back("the harmed process does not end");
    if (harmed.signal != 0 && !harmed.killed)
        verdict.wrong.push_back("the harmed process ended by signal " + std::to_string(harmed.signal));
    ++work.count.cases;
    if (verdict.wrong.empty()) {
        work.count.late += verdict.late ? 1 : 0;
        return true;
    }
    ++work.count.failures;
    work.failed(name, verdict.wrong);
    return false;
}

} // namespace rolvane::board
