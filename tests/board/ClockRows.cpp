#include "ClockRows.h"

#include <array>

namespace rolvane::board {

namespace {

struct Turn {
    const char* name;
    int64_t seconds;
};
constexpr int64_t kHour = 3600, kDay = 24 * kHour, kTenYears = 3653 * kDay;
constexpr std::array kTurns{Turn{"an hour ahead", kHour},       Turn{"an hour behind", -kHour},
                            Turn{"a day ahead", kDay - 1},      Turn{"a day behind", 1 - kDay},
                            Turn{"ten years ahead", kTenYears}, Turn{"ten years behind", -kTenYears}};

} // namespace

// The machine's clock is wrong for one pass, and right again for the next.
bool turnClockOnce(Work& work, size_t number) {
    if (number >= scenarios().size() * kTurns.size()) return false;
    const Scenario& scenario = scenarios()[number / kTurns.size()];
    const Turn& turn = kTurns[number % kTurns.size()];
    work.stage.forgetStory();
    work.stage.bringBack(scenario.name);
    Fault fault;
    fault.clock = turn.seconds;
    const Ending ending = work.stage.pass(scenario.role, fault);
    goOn(work, scenario, number);
    judge(work, scenario.name + ", the clock is " + turn.name, settlingOf(scenario), ending);
    return true;
}

void turnClock(Work& work) {
    for (size_t number = 0; number < scenarios().size() * kTurns.size(); ++number) {
        if (!work.isMine(number)) continue;
        if (work.timeIsOver()) return;
        turnClockOnce(work, number);
    }
}

} // namespace rolvane::board
