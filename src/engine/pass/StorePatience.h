#pragma once

#include "engine/pass/PassOutcome.h"

#include <optional>

namespace rolvane {

// How long somebody who waits for a store goes on asking one that cannot answer for the moment, and how long the pauses
// are. Decided from its failures alone: a value without a clock. All times are in seconds.
//
// A store that is too busy (408, 429, 502, 503, 504, or no answer in time) is asked for kForBusy, one that takes no
// connection, or gives one up, for kForAbsent: it may be starting. Everything else lasts. The first pause is
// kFirstPause, each further one twice as long, kLongestPause at most; each is a part longer or shorter, so that many
// who were sent away at once do not come back at once. No pause is shorter than the store has asked for (Retry-After).
class StorePatience {
public:
    static constexpr double kForBusy = 240, kForAbsent = 8;
    static constexpr double kFirstPause = 1, kLongestPause = 20;

    // How long to pause after a failure that came `spent` after the first attempt began; nothing: it is of no use, or
    // has taken long enough. `random` is from 0 to 1.
    std::optional<double> pauseAfter(const PassFailure& failure, double spent, double random);

private:
    double _pause = kFirstPause;
};

} // namespace rolvane
