#include "AskAgain.h"

#include "FailureText.h"
#include "Texts.h"

#include <cmath>
#include <fmt/format.h>
#include <thread>

namespace rolvane::cli {

bool AskAgain::after(const PassFailure& failure) {
    const std::chrono::duration<double> spent = std::chrono::steady_clock::now() - _began;
    const auto pause =
        _patience.pauseAfter(failure, spent.count(), std::uniform_real_distribution<double>(0, 1)(_random));
    if (!pause) return false;
    const FailureText text = failureText(failure, sceneOfTheAccount(Clock::system().now()));
    _context.say(tr("{} It is asked again in {} s.", text.what, std::max(1L, std::lround(*pause))));
    std::this_thread::sleep_for(std::chrono::duration<double>(*pause));
    return true;
}

} // namespace rolvane::cli
