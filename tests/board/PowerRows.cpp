#include "PowerRows.h"

#include "SurvivingDisk.h"

namespace rolvane::board {

namespace {

constexpr size_t kStates = 1000, kCommands = 10; // each so many-th is a command that has ended well

worlds::Chance chanceOf(const Work& work, size_t number) {
    return worlds::Chance(worlds::hashOf("power", work.stage.seed() * 10000 + number));
}

} // namespace

// The pass ends at some operation, and of what it wrote to files only what a disk keeps is there.
void losePowerOnce(Work& work, const Scenario& scenario, size_t number) {
    worlds::Chance chance = chanceOf(work, number);
    Stage& stage = work.stage;
    stage.bringBack(scenario.name);
    const int64_t whole = stage.pass(scenario.role, {.kind = FaultControl::kill, .at = INT32_MAX}).operations;
    stage.forgetStory();
    stage.bringBack(scenario.name);
    const std::string record = stage.scratch("record");
    const auto at = static_cast<int64_t>(chance.below(static_cast<size_t>(whole) + 1));
    const Ending ending = stage.pass(scenario.role, {.kind = FaultControl::kill, .at = at, .record = record});
    SurvivingDisk disk(stage.home(scenario.role), stage.kept(scenario.name, scenario.role));
    disk.read(record);
    stage.bringBackHome(scenario.name, scenario.role);
    const auto survives = chance.oneOf(std::vector{SurvivingDisk::Survives::nothing, SurvivingDisk::Survives::some,
                                                   SurvivingDisk::Survives::some, SurvivingDisk::Survives::everything});
    disk.write(survives, chance);
    stage.tell("   POWER LOSS, of what was not synced " +
               std::string(survives == SurvivingDisk::Survives::nothing ? "nothing"
                           : survives == SurvivingDisk::Survives::some  ? "some"
                                                                        : "everything") +
               " is there");
    stage.expireLocks(); // the note of it may be lost
    goOn(work, scenario, number);
    judge(work, scenario.name + ", power lost at " + std::to_string(at) + ", state " + std::to_string(number),
          settlingOf(scenario), ending);
}

// What a command has said to be done is there after a power loss.
void losePowerBehindACommand(Work& work, size_t number) {
    worlds::Chance chance = chanceOf(work, number);
    Stage& stage = work.stage;
    stage.forgetStory();
    stage.bringBack("in-step");
    const std::string record = stage.scratch("record"), mark = "Lasting" + std::to_string(number);
    const Ending ending = stage.command('o', {"add", "--first", mark}, {.record = record});
    SurvivingDisk disk(stage.home('o'), stage.kept("in-step", 'o'));
    disk.read(record);
    stage.bringBackHome("in-step", 'o');
    disk.write(SurvivingDisk::Survives::nothing, chance);
    Settling settling;
    settling.knowsDeeds = false;
    const size_t before = work.count.failures;
    judge(work, "power lost behind a command, state " + std::to_string(number), settling, ending);
    bool there = false;
    for (const auto& [name, text] : stage.view('r').whole) there |= text.find(mark) != std::string::npos;
    if (there || work.count.failures != before) return;
    ++work.count.failures;
    work.failed("power lost behind a command, state " + std::to_string(number), {"what it added is gone"});
}

void losePower(Work& work) {
    for (size_t number = 0; number < kStates; ++number) {
        if (!work.isMine(number)) continue;
        if (work.timeIsOver()) return;
        if (number / work.every % kCommands == 0)
            losePowerBehindACommand(work, number);
        else
            losePowerOnce(work, scenarios()[number % scenarios().size()], number);
    }
}

} // namespace rolvane::board
