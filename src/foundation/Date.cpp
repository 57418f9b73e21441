#include "foundation/Date.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdio>
#include <ctime>
#include <fmt/format.h>

namespace rolvane {

namespace {

constexpr std::array<const char*, 7> kDays{"Sun", "Mon", "Tue", "Wed", "Thu", "Fri", "Sat"};
constexpr std::array<const char*, 12> kMonths{"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                              "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};

struct Civil {
    int year, month, day, hour, minute, second, weekday;
};

constexpr double kFirst = -62135596800.0; // 0001-01-01T00:00:00Z
constexpr double kEnd = 253402300800.0;   // 10000-01-01T00:00:00Z

bool inRange(double seconds) {
    return seconds >= kFirst && seconds < kEnd;
}

Civil civil(double seconds) {
    using namespace std::chrono;
    if (!inRange(seconds)) seconds = std::isnan(seconds) ? 0 : seconds < kFirst ? kFirst : kEnd - 1;
    const double whole = std::floor(seconds);
    const sys_seconds at{std::chrono::seconds{static_cast<int64_t>(whole)}};
    const auto midnight = floor<days>(at);
    const year_month_day ymd{midnight};
    const hh_mm_ss time{at - midnight};
    return {static_cast<int>(ymd.year()),
            static_cast<int>(static_cast<unsigned>(ymd.month())),
            static_cast<int>(static_cast<unsigned>(ymd.day())),
            static_cast<int>(time.hours().count()),
            static_cast<int>(time.minutes().count()),
            static_cast<int>(time.seconds().count()),
            static_cast<int>(weekday{midnight}.c_encoding())};
}

std::optional<double> fromCivil(int y, int mo, int d, int h, int mi, int s) {
    using namespace std::chrono;
    const year_month_day ymd{year{y}, month{static_cast<unsigned>(mo)}, day{static_cast<unsigned>(d)}};
    if (!ymd.ok() || h < 0 || h > 23 || mi < 0 || mi > 59 || s < 0 || s > 60) return std::nullopt;
    return static_cast<double>(sys_days{ymd}.time_since_epoch().count()) * 86400.0 + h * 3600.0 + mi * 60.0 + s;
}

// Reads exactly `digits` digits; false when there are fewer.
bool number(std::string_view& text, size_t digits, int& out) {
    if (text.size() < digits) return false;
    out = 0;
    for (size_t i = 0; i < digits; ++i) {
        if (text[i] < '0' || text[i] > '9') return false;
        out = out * 10 + (text[i] - '0');
    }
    text.remove_prefix(digits);
    return true;
}

bool literal(std::string_view& text, char c) {
    if (text.empty() || text[0] != c) return false;
    text.remove_prefix(1);
    return true;
}

// Takes ".25"; 0 when there is no point, nothing when no digit follows it.
std::optional<double> fraction(std::string_view& text) {
    if (!literal(text, '.')) return 0.0;
    const size_t size = std::min(text.find_first_not_of("0123456789"), text.size());
    if (size == 0) return std::nullopt;
    double part = 0, unit = 0.1;
    for (const char c : text.substr(0, size)) {
        part += (c - '0') * unit;
        unit /= 10;
    }
    text.remove_prefix(size);
    return part;
}

// Takes "Z", "+01:30" or "+0130"; the offset in seconds.
std::optional<double> offsetFromUTC(std::string_view& text) {
    if (literal(text, 'Z')) return 0.0;
    const double sign = !text.empty() && text[0] == '-' ? -1 : 1;
    int hours, minutes;
    if (!(literal(text, '+') || literal(text, '-')) || !number(text, 2, hours)) return std::nullopt;
    literal(text, ':');
    if (!number(text, 2, minutes) || hours > 23 || minutes > 59) return std::nullopt;
    return sign * (hours * 3600 + minutes * 60);
}

int monthNamed(std::string_view name) {
    for (size_t i = 0; i < kMonths.size(); ++i)
        if (name == kMonths[i]) return static_cast<int>(i) + 1;
    return 0;
}

} // namespace

bool Date::isRepresentable() const {
    return inRange(_seconds);
}

std::string Date::toISO8601() const {
    const Civil c = civil(_seconds);
    return fmt::format("{:04}-{:02}-{:02}T{:02}:{:02}:{:02}Z", c.year, c.month, c.day, c.hour, c.minute, c.second);
}

std::string Date::toISO8601Precise() const {
    const double whole = std::floor(_seconds);
    double micros = std::round((_seconds - whole) * 1e6);
    const bool carry = micros >= 1e6;
    if (carry || !isRepresentable()) micros = 0;
    const Civil c = civil(carry ? whole + 1 : whole);
    return fmt::format("{:04}-{:02}-{:02}T{:02}:{:02}:{:02}.{:06}Z", c.year, c.month, c.day, c.hour, c.minute, c.second,
                       static_cast<int>(micros));
}

std::string Date::toHTTP() const {
    const Civil c = civil(_seconds);
    return fmt::format("{}, {:02} {} {:04} {:02}:{:02}:{:02} GMT", kDays[static_cast<size_t>(c.weekday)], c.day,
                       kMonths[static_cast<size_t>(c.month - 1)], c.year, c.hour, c.minute, c.second);
}

std::optional<Date> Date::fromISO8601(std::string_view t) {
    int y, mo, d, h, mi, s;
    if (!number(t, 4, y) || !literal(t, '-') || !number(t, 2, mo) || !literal(t, '-') || !number(t, 2, d) ||
        !(literal(t, 'T') || literal(t, ' ')) || !number(t, 2, h) || !literal(t, ':') || !number(t, 2, mi) ||
        !literal(t, ':') || !number(t, 2, s))
        return std::nullopt;
    const auto part = fraction(t);
    const auto offset = part ? offsetFromUTC(t) : std::nullopt;
    const auto seconds = fromCivil(y, mo, d, h, mi, s);
    if (!part || !offset || !t.empty() || !seconds) return std::nullopt;
    const Date date(*seconds + *part - *offset);
    return date.isRepresentable() ? std::optional<Date>(date) : std::nullopt;
}

std::optional<Date> Date::fromHTTP(std::string_view text) {
    const std::string s(text);
    char month[4] = {};
    int y = 0, d = 0, h = 0, mi = 0, sec = 0, used = 0;
    const int length = static_cast<int>(s.size());
    if (std::sscanf(s.c_str(), "%*3s, %2d %3s %4d %2d:%2d:%2d GMT%n", &d, month, &y, &h, &mi, &sec, &used) == 6 &&
        used == length) {
        // IMF-fixdate
    } else if (used = 0, std::sscanf(s.c_str(), "%*[A-Za-z], %2d-%3s-%2d %2d:%2d:%2d GMT%n", &d, month, &y, &h, &mi,
                                     &sec, &used) == 6 &&
                             used == length) {
        y += y < 70 ? 2000 : 1900; // RFC 850 form
    } else if (used = 0,
               std::sscanf(s.c_str(), "%*3s %3s %2d %2d:%2d:%2d %4d%n", month, &d, &h, &mi, &sec, &y, &used) == 6 &&
                   used == length) {
        // asctime form
    } else {
        return std::nullopt;
    }
    const int mo = monthNamed(month);
    if (!mo) return std::nullopt;
    const auto seconds = fromCivil(y, mo, d, h, mi, sec);
    return seconds && inRange(*seconds) ? std::optional<Date>(Date(*seconds)) : std::nullopt;
}

namespace {

class SystemClock : public Clock {
public:
    Date now() const override {
        return Date(std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count());
    }
};

} // namespace

Clock& Clock::system() {
    static SystemClock clock;
    return clock;
}

} // namespace rolvane
