#include "foundation/LogSinks.h"

#include "foundation/Date.h"
#include "foundation/Mutex.h"

#include <cerrno>
#include <cstdio>

#include <fmt/format.h>
#include <sys/syscall.h>
#include <sys/uio.h>
#include <unistd.h>

#define SD_JOURNAL_SUPPRESS_LOCATION
#include <systemd/sd-journal.h>

namespace rolvane {

namespace {

void writeFully(int fd, std::string_view bytes) {
    while (!bytes.empty()) {
        ssize_t n = ::write(fd, bytes.data(), bytes.size());
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return; // there is nobody left to tell
        bytes.remove_prefix(static_cast<size_t>(n));
    }
}

} // namespace

LogDestination chooseLogDestination(std::string_view request, bool journalSocketExists, bool standardErrorIsTerminal) {
    if (request == "stderr" || !journalSocketExists) return LogDestination::standardError;
    if (request == "journal") return LogDestination::journal;
    return standardErrorIsTerminal ? LogDestination::standardError : LogDestination::journal;
}

std::vector<std::string> journalFields(const LogEvent& event, std::string_view identifier, bool withNames) {
    std::vector<std::string> fields{fmt::format("MESSAGE={}", withNames ? event.line : event.publicLine),
                                    fmt::format("MESSAGE_ID={}", event.kind->messageId),
                                    fmt::format("PRIORITY={}", event.kind->priority),
                                    fmt::format("SYSLOG_IDENTIFIER={}", identifier),
                                    fmt::format("TID={}", ::syscall(SYS_gettid)),
                                    fmt::format("ROLVANE_EVENT={}", event.kind->name)};
    if (!event.format.empty()) fields.push_back("ROLVANE_FORMAT=" + event.format);
    return fields;
}

std::string standardErrorLine(std::string_view line, std::string_view identifier) {
    std::string out =
        fmt::format("{} {}[{}]: ", Clock::system().now().toISO8601Precise(), identifier, static_cast<long>(getpid()));
    for (char c : line) {
        auto byte = static_cast<unsigned char>(c);
        if (c == '\n')
            out += "\n\t";
        else if ((byte < 0x20 && c != '\t') || byte == 0x7f)
            out += fmt::format("\\x{:02x}", byte);
        else
            out += c;
    }
    return out += '\n';
}

void JournalSink::write(std::string_view line) {
    writeEvent(logEvent("%@", {{std::string(line)}}));
}

void JournalSink::writeEvent(const LogEvent& event) {
    auto fields = journalFields(event, program_invocation_short_name, debugLevel() != 0);
    std::vector<iovec> vectors;
    for (auto& field : fields) vectors.push_back({field.data(), field.size()});
    if (sd_journal_sendv(vectors.data(), static_cast<int>(vectors.size())) < 0)
        writeFully(STDERR_FILENO, standardErrorLine(event.line, program_invocation_short_name));
}

void StandardErrorSink::write(std::string_view line) {
    std::string text = standardErrorLine(line, program_invocation_short_name);
    Lock guard(_mutex);
    writeFully(STDERR_FILENO, text);
}

} // namespace rolvane
