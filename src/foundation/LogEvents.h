#pragma once

#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

namespace detail {
struct LogArgument;
}

// A kind of event in the log. `journalctl -x` shows the catalog's text for its identifier.
struct LogKind {
    const char* name;
    const char* messageId; // 32 hexadecimal digits; never changes
    int priority;          // as syslog counts: 3 error, 4 warning, 5 notice, 6 information, 7 progress
};

// One line of the log with what is known of it.
struct LogEvent {
    std::string line;
    std::string publicLine; // the same without names and contents
    std::string format;     // the words around them
    const LogKind* kind;
};

LogEvent logEvent(std::string_view format, const std::vector<detail::LogArgument>& arguments);
LogEvent progressEvent(std::string line); // of the diagnostic log: shown only to who asked for it, so with all names

std::span<const LogKind* const> logKinds();
// Whether the format has a kind and as many marks as placeholders. Others are logged all the same, with all texts
// hidden.
bool isKnownFormat(std::string_view format);

// A reason in words without what may name somebody: quoted texts, paths of addresses, paths of files outside the home,
// mail addresses and numbers of telephones give way to "…". Pure, but for the home.
std::string withoutNames(std::string_view text);

} // namespace rolvane
