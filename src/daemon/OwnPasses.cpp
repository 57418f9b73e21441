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
    _schedule.newsCame(_with.now() + spreadSeconds);
    arm();
}

void OwnPasses::lookIntervalChanged() {
    arm();
}

void OwnPasses::arm() {
    const auto next = _schedule.next(_with.lookInterval());
    _with.wakeAt(next && !waitsForPreparation(next->what) ? std::optional(next->at) : std::nullopt);
}

bool OwnPasses::waitsForPreparation(RetrySchedule::What what) const {
    return _preparing && what == RetrySchedule::What::pass;
}

void OwnPasses::passEnded(const PassResult& pass) {
    _schedule.ended(pass, _with.now());
    arm();
}

void OwnPasses::networkChanged() {
    _schedule.networkChanged(_with.now());
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
    const auto next = _schedule.next(_with.lookInterval());
    if (!next || next->at > _with.now() || waitsForPreparation(next->what)) return;
    if (next->what == RetrySchedule::What::pass && !prepared && _with.prepare) {
        _preparing = _with.prepare([this] {
            _preparing = false;
            doWhatIsDue(true);
        });
        if (_preparing) return;
    }
    _schedule.beginsAttempt(_with.now());
    if (next->what == RetrySchedule::What::pass) return _with.pass();
    const bool asks = next->what == RetrySchedule::What::ask;
    const Answer answer = asks ? _with.askStore() : _with.networkIsBack();
    if (!answer.isThere) return _schedule.storeWasAway(_with.now(), answer.retryAfter);
    if (asks) _with.pass();
}

} // namespace rolvane
