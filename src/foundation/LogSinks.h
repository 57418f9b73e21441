#pragma once

#include "foundation/Log.h"

#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

enum class LogDestination { journal, standardError };

// The choice alone: `request` is the value of $ROLVANE_LOG ("stderr", "journal", anything else leaves the choice).
LogDestination chooseLogDestination(std::string_view request, bool journalSocketExists, bool standardErrorIsTerminal);

// The journal's fields of a line, each "NAME=value": MESSAGE, PRIORITY, SYSLOG_IDENTIFIER, TID.
std::vector<std::string> journalFields(std::string_view line, std::string_view identifier);

// "<time> <identifier>[<pid>]: <line>\n" for people and files. Lines inside the text are indented, so that no text can
// pass itself off as an entry of its own; other control characters are shown as \xNN, so that none reaches a terminal.
std::string standardErrorLine(std::string_view line, std::string_view identifier);

class JournalSink : public LogSink {
public:
    void write(std::string_view line) override;
};

// One write(2) a line; lines of several threads do not mix.
class StandardErrorSink : public LogSink {
public:
    void write(std::string_view line) override;

private:
    std::mutex _mutex;
};

} // namespace rolvane
