#include "foundation/Log.h"

#include "foundation/LogEvents.h"
#include "foundation/LogSinks.h"
#include "foundation/Mutex.h"

#include <atomic>
#include <charconv>
#include <cstdio>
#include <cstdlib>

#include <unistd.h>

namespace rolvane {

namespace {

std::atomic<int> theDebugLevel{0};

std::shared_ptr<LogSink> makePlatformSink() {
    const char* request = std::getenv("ROLVANE_LOG");
    bool journal = ::access("/run/systemd/journal/socket", F_OK) == 0;
    if (chooseLogDestination(request ? request : "", journal, ::isatty(STDERR_FILENO)) == LogDestination::journal)
        return std::make_shared<JournalSink>();
    return std::make_shared<StandardErrorSink>();
}

struct Sinks {
    Mutex mutex;
    std::shared_ptr<LogSink> installed GUARDED_BY(mutex); // none: the platform's
    std::shared_ptr<LogSink> platform GUARDED_BY(mutex);
};

// Never destroyed: lines may come from destructors that run at the end of the process.
Sinks& sinks() {
    static Sinks* all = new Sinks;
    return *all;
}

struct Placeholder {
    bool left = false, zero = false;
    size_t width = 0;
    std::optional<size_t> precision;
    char conversion = 0;
    size_t length = 0; // characters of the format, the percent included
};

constexpr size_t kWidest = 4096;

size_t readNumber(std::string_view text, size_t& at) {
    size_t n = 0;
    for (; at < text.size() && text[at] >= '0' && text[at] <= '9'; ++at)
        n = std::min(kWidest, n * 10 + static_cast<size_t>(text[at] - '0'));
    return n;
}

// `text` begins with '%'. Nothing when it is not a placeholder.
std::optional<Placeholder> readPlaceholder(std::string_view text) {
    Placeholder p;
    size_t at = 1;
    for (; at < text.size() && (text[at] == '-' || text[at] == '0'); ++at) (text[at] == '-' ? p.left : p.zero) = true;
    p.width = readNumber(text, at);
    if (at < text.size() && text[at] == '.') p.precision = readNumber(text, ++at);
    while (at < text.size() && (text[at] == 'l' || text[at] == 'h' || text[at] == 'z')) ++at;
    if (at >= text.size() || std::string_view("@sduifgxXcp").find(text[at]) == std::string_view::npos) return {};
    p.conversion = text[at];
    p.length = at + 1;
    return p;
}

std::string hexadecimal(const std::string& text, bool upper) {
    long long number = 0;
    auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
    if (error != std::errc() || end != text.data() + text.size()) return text;
    char out[32];
    std::snprintf(out, sizeof out, upper ? "%llX" : "%llx", static_cast<unsigned long long>(number));
    return out;
}

std::string fixed(const std::string& text, size_t digits) {
    char* end = nullptr;
    double number = std::strtod(text.c_str(), &end);
    if (text.empty() || *end) return text;
    std::string out(400 + std::min<size_t>(digits, 100), 0);
    int n = std::snprintf(out.data(), out.size(), "%.*f", static_cast<int>(std::min<size_t>(digits, 100)), number);
    out.resize(static_cast<size_t>(n));
    return out;
}

std::string render(const Placeholder& p, std::string text) {
    if (p.conversion == 'x' || p.conversion == 'X') text = hexadecimal(text, p.conversion == 'X');
    if (p.conversion == 'f' && p.precision) text = fixed(text, *p.precision);
    if (p.conversion == 's' && p.precision) text = text.substr(0, *p.precision);
    if (text.size() >= p.width) return text;
    size_t missing = p.width - text.size();
    if (p.left) return text + std::string(missing, ' ');
    if (p.zero && p.conversion != 's' && p.conversion != '@')
        return text.insert(!text.empty() && text[0] == '-' ? 1 : 0, missing, '0');
    return std::string(missing, ' ') + text;
}

} // namespace

std::shared_ptr<LogSink> LogSink::install(std::shared_ptr<LogSink> sink) {
    Lock guard(sinks().mutex);
    std::swap(sinks().installed, sink);
    return sink;
}

std::shared_ptr<LogSink> LogSink::current() {
    Lock guard(sinks().mutex);
    if (sinks().installed) return sinks().installed;
    if (!sinks().platform) sinks().platform = makePlatformSink();
    return sinks().platform;
}

void LogSink::writeEvent(const LogEvent& event) {
    write(event.line);
}

int debugLevel() {
    return theDebugLevel.load(std::memory_order_relaxed);
}
void setDebugLevel(int level) {
    theDebugLevel.store(level, std::memory_order_relaxed);
}

namespace detail {

std::string formatLog(std::string_view format, const std::vector<LogArgument>& arguments) {
    std::string out;
    size_t next = 0;
    while (!format.empty()) {
        size_t percent = format.find('%');
        out += format.substr(0, percent);
        if (percent == std::string_view::npos) break;
        format.remove_prefix(percent);
        if (format.substr(0, 2) == "%%") {
            out += '%';
            format.remove_prefix(2);
        } else if (auto p = readPlaceholder(format); p && next < arguments.size()) {
            out += render(*p, arguments[next++].text);
            format.remove_prefix(p->length);
        } else {
            out += '%';
            format.remove_prefix(1);
        }
    }
    return out;
}

void writeLog(std::string_view format, const std::vector<LogArgument>& arguments) {
    LogSink::current()->writeEvent(logEvent(format, arguments));
}

void writeProgress(std::string line) {
    LogSink::current()->writeEvent(progressEvent(std::move(line)));
}

} // namespace detail

} // namespace rolvane
