#include "engine/IdleExit.h"

#include <utility>

namespace rolvane {

IdleExit& IdleExit::process() {
    // Never destroyed: its timer belongs to a run loop that ends with its thread.
    static IdleExit* const shared = new IdleExit;
    return *shared;
}

void IdleExit::arm(RunLoop& loop, std::function<void()> fire) {
    if (_interval == kNever) return;
    _timer.reset();
    _timer = loop.scheduleTimer(static_cast<double>(_interval), std::move(fire));
}

void IdleExit::disarm() {
    _timer.reset();
}

} // namespace rolvane
