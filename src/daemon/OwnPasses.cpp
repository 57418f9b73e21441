#include "daemon/OwnPasses.h"

#include <algorithm>

namespace rolvane {

double OwnPasses::lookIntervalOf(std::optional<double> preference) {
    if (!preference) return kLookInterval;
    return *preference > 0 ? std::max(*preference, kShortestLook) : 0;
}

double OwnPasses::lookIntervalWithNews(double lookInterval) {
    return lookInterval > 0 ? std::max(lookInterval, kLookIntervalWithNews) : 0;
}

void OwnPasses::newsCame(double spreadSeconds) {
    _schedule.newsCame(_world.now() + spreadSeconds);
    arm();
}

void OwnPasses::lookIntervalChanged() {
    arm();
}

void OwnPasses::arm() {
    const auto next = _schedule.next(_world.lookInterval());
    _world.wakeAt(next && !waitsForPreparation(next->what) ? std::optional(next->at) : std::nullopt);
}

bool OwnPasses::waitsForPreparation(RetrySchedule::What what) const {
    return _preparing && what == RetrySchedule::What::pass;
}

void OwnPasses::passEnded(const PassResult& pass) {
    _schedule.ended(pass, _world.now());
    arm();
}

void OwnPasses::networkChanged() {
    _schedule.networkChanged(_world.now());
    arm();
}

void OwnPasses::wake() {
    doWhatIsDue(false);
}

void OwnPasses::doWhatIsDue(bool prepared) {
    struct Rearmed { // whatever way a pass ends
        OwnPasses& own;
        ~Rearmed() { own.arm(); }
    } rearmed{*this};
    const auto next = _schedule.next(_world.lookInterval());
    if (!next || next->at > _world.now() || waitsForPreparation(next->what)) return;
    if (next->what == RetrySchedule::What::pass && !prepared && _world.prepare) {
        _preparing = _world.prepare([this] {
            _preparing = false;
            doWhatIsDue(true);
        });
        if (_preparing) return;
    }
    _schedule.beginsAttempt(_world.now());
    if (next->what == RetrySchedule::What::pass) return _world.pass();
    const bool asks = next->what == RetrySchedule::What::ask;
    const Answer answer = asks ? _world.askStore() : _world.networkIsBack();
    if (!answer.isThere) return _schedule.storeWasAway(_world.now(), answer.retryAfter);
    if (asks) _world.pass();
}

} // namespace rolvane
