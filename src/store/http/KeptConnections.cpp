#include "store/http/KeptConnections.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>
#include <ctime>
#include <strings.h>

namespace rolvane {

bool mayBeSentTwice(std::string_view method) {
    static constexpr std::array<std::string_view, 13> kMethods{"GET",    "HEAD",     "OPTIONS", "PUT",  "DELETE",
                                                               "MKCOL",  "PROPFIND", "COPY",    "MOVE", "PROPPATCH",
                                                               "UNLOCK", "ACL",      "LOCK"};
    return std::find(kMethods.begin(), kMethods.end(), method) != kMethods.end();
}

std::optional<int> keepAliveSeconds(const HttpResponse& answer) {
    constexpr std::string_view kName = "timeout=";
    const std::string* text = answer.header("keep-alive");
    for (size_t at = 0; text && at < text->size(); ++at) {
        const bool begins = at == 0 || std::string_view(" \t,;").find((*text)[at - 1]) != std::string_view::npos;
        if (!begins || strncasecmp(text->c_str() + at, kName.data(), kName.size()) != 0) continue;
        int seconds = 0;
        const char* digits = text->data() + at + kName.size();
        const auto [end, fault] = std::from_chars(digits, text->data() + text->size(), seconds);
        if (fault == std::errc() && end != digits && seconds >= 0) return seconds;
    }
    return std::nullopt;
}

double KeptConnections::secondsAsleep() {
    timespec withSleep{}, without{};
    ::clock_gettime(CLOCK_MONOTONIC, &without);
    ::clock_gettime(CLOCK_BOOTTIME, &withSleep);
    return static_cast<double>(withSleep.tv_sec - without.tv_sec) +
           static_cast<double>(withSleep.tv_nsec - without.tv_nsec) / 1e9;
}

void KeptConnections::heard(const std::string& origin, const HttpResponse& answer) {
    if (const auto seconds = keepAliveSeconds(answer)) _promised[origin] = *seconds;
}

bool KeptConnections::hasSlept() {
    const double asleep = _asleep();
    if (asleep - _slept <= 1) return false;
    _slept = asleep;
    return true;
}

int KeptConnections::longestIdle(const std::string& origin, Steady now) const {
    int longest = kLongest;
    if (const auto promised = _promised.find(origin); promised != _promised.end())
        longest = std::min(longest, std::max(0, promised->second - kMargin));
    if (const auto dead = _deadBefore.find(origin); dead != _deadBefore.end()) {
        const auto since = std::chrono::duration_cast<std::chrono::seconds>(now - dead->second).count();
        longest = static_cast<int>(std::clamp<int64_t>(since - 1, 0, longest));
    }
    return longest;
}

} // namespace rolvane
