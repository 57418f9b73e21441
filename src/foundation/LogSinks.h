#pragma once

#include "foundation/Log.h"
#include "foundation/LogEvents.h"
#include "foundation/Mutex.h"

#include <memory>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

enum class LogDestination { journal, standardError };

// The choice alone: `request` is the value of $ROLVANE_LOG ("stderr", "journal", anything else leaves the choice).
LogDestination chooseLogDestination(std::string_view request, bool journalSocketExists, bool standardErrorIsTerminal);

// The journal's fields of a line, each "NAME=value": MESSAGE, MESSAGE_ID, PRIORITY, SYSLOG_IDENTIFIER, TID,
// ROLVANE_EVENT (the kind's name), and ROLVANE_FORMAT where the line has one. Names and contents are in it only where
// `withNames`.
std::vector<std::string> journalFields(const LogEvent& event, std::string_view identifier, bool withNames);

// "<time> <identifier>[<pid>]: <line>\n" for people and files. Lines inside the text are indented, so that no text can
// pass itself off as an entry of its own; other control characters are shown as \xNN, so that none reaches a terminal.
std::string standardErrorLine(std::string_view line, std::string_view identifier);

// At debug level 0 without names and contents: administrators and backups read the journal, too.
class JournalSink : public LogSink {
public:
    void write(std::string_view line) override; // as an event that nothing is known of
    void writeEvent(const LogEvent& event) override;
};

// One write(2) a line; lines of several threads do not mix.
class StandardErrorSink : public LogSink {
public:
    void write(std::string_view line) override;

private:
    Mutex _mutex;
};

} // namespace rolvane
