#include "OutcomeWatch.h"

#include "foundation/Preferences.h"

namespace rolvane::cli {

OutcomeWatch::OutcomeWatch(Context& context) : _wish(wishForAPass(Preferences::shared())) {
    _observation = context.bus().observe(
        kCXDPassEndedNotification,
        [this](const Notification& notification) {
            const auto outcome = decodeOutcome(notification.userInfo);
            if (outcome && answers(*outcome, _wish)) _heard = outcome;
        },
        false);
}

std::optional<PassOutcome> OutcomeWatch::latest() {
    auto stored = lastOutcome(Preferences::shared());
    if (stored && !answers(*stored, _wish)) stored.reset();
    return stored && _heard ? (stored->number >= _heard->number ? stored : _heard) : stored ? stored : _heard;
}

std::optional<PassOutcome> OutcomeWatch::settled() {
    auto outcome = latest();
    if (outcome && outcome->anotherFollows) outcome.reset();
    return outcome;
}

} // namespace rolvane::cli
