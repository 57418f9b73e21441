#pragma once

#include <atomic>
#include <chrono>
#include <compare>
#include <limits>
#include <optional>
#include <string>
#include <string_view>

namespace rolvane {

// An instant: seconds since 1970-01-01T00:00:00Z as a double (microseconds are kept for any date of this era).
class Date {
public:
    constexpr Date() = default;
    explicit constexpr Date(double secondsSince1970) : _seconds(secondsSince1970) {}

    static constexpr Date distantPast() { return Date(-62135769600.0); }  // 0001-01-01
    static constexpr Date distantFuture() { return Date(64092211200.0); } // 4001-01-01

    constexpr double secondsSince1970() const { return _seconds; }
    constexpr Date addingSeconds(double s) const { return Date(_seconds + s); }
    constexpr double secondsSince(Date other) const { return _seconds - other._seconds; }

    // Whether the texts below can say it: a finite number within the years 1 to 9999. Those of any other date are of
    // the nearest end of that time (1970 for one that is no number).
    bool isRepresentable() const;
    // "2026-11-20T23:48:00Z", whole seconds, rounded towards the past (XML property lists, RFC 3339 section 5.6).
    std::string toISO8601() const;
    // The same rounded to microseconds, for logs and listings.
    std::string toISO8601Precise() const;
    // "Fri, 20 Nov 2026 23:48:00 GMT" (IMF-fixdate, RFC 9110 section 5.6.7).
    std::string toHTTP() const;

    // Each gives nothing for text that is not such a date or is not representable. The first accepts fractions of a
    // second and offsets from UTC.
    static std::optional<Date> fromISO8601(std::string_view text);
    static std::optional<Date> fromHTTP(std::string_view text); // all three forms that RFC 9110 section 5.6.7 names

    friend constexpr auto operator<=>(const Date&, const Date&) = default;
    friend std::string description(const Date& d) { return d.toISO8601(); }

private:
    double _seconds = 0;
};

// Where the time comes from. Exists so that tests can replace it; any thread.
class Clock {
public:
    virtual ~Clock() = default;
    virtual Date now() const = 0;

    static Clock& system(); // lives for the process
};

// A clock that stands until it is moved. For tests; any thread may read it, one moves it.
class ManualClock : public Clock {
public:
    explicit ManualClock(Date start) : _now(start.secondsSince1970()) {}
    Date now() const override { return Date(_now.load()); }
    void set(Date d) { _now = d.secondsSince1970(); }
    void advance(double seconds) { _now = _now.load() + seconds; }

private:
    std::atomic<double> _now;
};

} // namespace rolvane
