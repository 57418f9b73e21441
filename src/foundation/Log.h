#pragma once

#include <concepts>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <vector>

namespace rolvane {

struct LogEvent;

// Where log lines go: the journal (structured fields), or standard error where there is no journal or standard error
// is a terminal or $ROLVANE_LOG is "stderr" (chosen at the first line of the process). Exists so that tests can
// replace it. Called from any thread; must not throw.
class LogSink {
public:
    virtual ~LogSink() = default;
    virtual void write(std::string_view line) = 0;
    virtual void writeEvent(const LogEvent& event); // as a line, where nothing else is known of events

    // Installs a sink for the process and gives back the former one; none restores the platform's sink.
    static std::shared_ptr<LogSink> install(std::shared_ptr<LogSink> sink);
    static std::shared_ptr<LogSink> current();
};

// Process-wide debug level; zero silences CXDLog. Any thread.
int debugLevel();
void setDebugLevel(int level);

namespace detail {

// One rendered argument. "%@" shows an object's description; "%s", "%d", "%u", "%i", "%f", "%x" as printf does.
struct LogArgument {
    std::string text;
};

template <class T>
concept HasDescriptionMember = requires(const T& t) {
    { t.description() } -> std::convertible_to<std::string>;
};
template <class T>
concept HasDescriptionFunction = requires(const T& t) {
    { description(t) } -> std::convertible_to<std::string>;
};

template <class T>
LogArgument logArgument(const T& value);
template <class T>
std::string describeRange(const T& range);

template <class T>
std::string describeObject(const T& value) {
    if constexpr (std::is_same_v<std::decay_t<T>, const char*> || std::is_same_v<std::decay_t<T>, char*>) {
        const char* text = value;
        return text ? text : "(null)";
    } else if constexpr (std::is_convertible_v<T, std::string>)
        return value;
    else if constexpr (std::is_convertible_v<T, std::string_view>)
        return std::string(std::string_view(value));
    else if constexpr (std::is_same_v<T, bool>)
        return value ? "true" : "false";
    else if constexpr (std::is_arithmetic_v<T>)
        return std::to_string(value);
    else if constexpr (HasDescriptionMember<T>)
        return value.description();
    else if constexpr (HasDescriptionFunction<T>)
        return description(value);
    else if constexpr (std::is_enum_v<T>)
        return std::to_string(static_cast<std::underlying_type_t<T>>(value));
    else if constexpr (requires {
                           *value;
                           static_cast<bool>(value);
                       }) // pointers, optionals
        return value ? describeObject(*value) : "(null)";
    else
        return describeRange(value);
}

// A list shows as the platform's arrays do: "(", one element a line, ")".
template <class T>
std::string describeRange(const T& range) {
    std::string out = "(\n";
    for (const auto& element : range) out += "    " + describeObject(element) + ",\n";
    return out + ")";
}

template <class T>
LogArgument logArgument(const T& value) {
    return {describeObject(value)};
}

// Placeholders may carry the printf flags '-' and '0', a width, and a precision (digits after the point of "%f",
// longest text of "%s"). A placeholder without an argument stays as it is written; surplus arguments are not shown.
std::string formatLog(std::string_view format, const std::vector<LogArgument>& arguments);
void writeLog(std::string_view format, const std::vector<LogArgument>& arguments);
void writeProgress(std::string line);

} // namespace detail

// printf-style with object placeholders: "Mingled: %@". Placeholders take the arguments in order; "%%" is a percent.
template <class... Args>
std::string CXFormat(std::string_view format, const Args&... args) {
    return detail::formatLog(format, {detail::logArgument(args)...});
}

// The system log, whatever the debug level.
template <class... Args>
void CXLog(std::string_view format, const Args&... args) {
    detail::writeLog(format, {detail::logArgument(args)...});
}

// The daemon's diagnostic log: nothing at all, not even formatting, at debug level 0.
template <class... Args>
void CXDLog(std::string_view format, const Args&... args) {
    if (debugLevel() != 0) detail::writeProgress(CXFormat(format, args...));
}

} // namespace rolvane
