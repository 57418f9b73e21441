#include "foundation/Log.h"
#include "foundation/CXException.h"
#include "foundation/LogSinks.h"
#include "foundation/Value.h"
#include "support/CapturingLog.h"
#include "support/ChildProcess.h"
#include "support/TempHome.h"

#include <cerrno>
#include <functional>
#include <memory>
#include <optional>
#include <regex>
#include <thread>

#include <gtest/gtest.h>
#include <sys/uio.h>
#include <unistd.h>

using namespace rolvane;
using namespace rolvane::test;

namespace {

struct Described {
    static inline int asked = 0;
    std::string description() const {
        ++asked;
        return "described";
    }
};

// Stands in for the journal: what the sink hands over, and the answer that it gets.
std::vector<std::string> journalled;
int journalAnswer = 0;

enum class Kind { first = 1, second = 2 };

} // namespace

// Found before the library's function of that name, since it is in the program.
extern "C" int sd_journal_sendv(const iovec* fields, int count) {
    journalled.clear();
    for (int i = 0; i < count; ++i)
        journalled.emplace_back(static_cast<const char*>(fields[i].iov_base), fields[i].iov_len);
    return journalAnswer;
}

TEST(LogFormat, ObjectPlaceholdersShowDescriptions) {
    EXPECT_EQ(CXFormat("Mingled: %@.", Described{}), "Mingled: described.");
    EXPECT_EQ(CXFormat("%@ and %@", "text", std::string("string")), "text and string");
    EXPECT_EQ(CXFormat("%@", std::string_view("view")), "view");
    EXPECT_EQ(CXFormat("%@", Value("v")), "v");
    EXPECT_EQ(CXFormat("Quitting due to an unhandled exception: %@", CXException(kCXRangeException, "beyond the end")),
              "Quitting due to an unhandled exception: beyond the end");
    EXPECT_EQ(CXFormat("%@", Kind::second), "2");
}

TEST(LogFormat, AbsentObjectsShowAsNull) {
    EXPECT_EQ(CXFormat("%@", Value()), "(null)");
    EXPECT_EQ(CXFormat("%@", std::shared_ptr<Described>()), "(null)");
    EXPECT_EQ(CXFormat("%@", std::optional<std::string>()), "(null)");
    EXPECT_EQ(CXFormat("%s", static_cast<const char*>(nullptr)), "(null)");
    EXPECT_EQ(CXFormat("%@", std::optional<std::string>("there")), "there");
    EXPECT_EQ(CXFormat("%@", std::make_shared<Described>()), "described");
}

TEST(LogFormat, AListShowsOneElementALine) {
    EXPECT_EQ(CXFormat("%@", std::vector<std::string>{"a", "b"}), "(\n    a,\n    b,\n)");
    EXPECT_EQ(CXFormat("%@", std::vector<std::string>{}), "(\n)");
}

TEST(LogFormat, NumbersShowAsPrintfShowsThem) {
    EXPECT_EQ(CXFormat("%d %i %u %ld %lld %zu", -1, 2, 3u, -4L, 5LL, size_t(6)), "-1 2 3 -4 5 6");
    EXPECT_EQ(CXFormat("%f|%.2f|%.0f", 0.5, 1.239, 7.0), "0.500000|1.24|7");
    EXPECT_EQ(CXFormat("%x %X %04x", 255, 255, 10), "ff FF 000a");
    EXPECT_EQ(CXFormat("[%5d] [%-5d] [%05d] [%8s] [%.2s]", 42, 42, -42, "text", "text"),
              "[   42] [42   ] [-0042] [    text] [te]");
}

TEST(LogFormat, PercentSignsAndPlaceholdersWithoutArgumentsStayAsTheyAre) {
    EXPECT_EQ(CXFormat("100%% of %@ and %@", "x"), "100% of x and %@");
    EXPECT_EQ(CXFormat("%"), "%");
    EXPECT_EQ(CXFormat("50% %q %", "x"), "50% %q %");
    EXPECT_EQ(CXFormat("none", 1, 2), "none");
}

TEST(LogFormat, WhatAnArgumentContainsIsNotFormattedAgain) {
    EXPECT_EQ(CXFormat("%@ %@", "%@%s%n", "x"), "%@%s%n x");
}

TEST(Log, TheDiagnosticLogIsSilentAndFormatsNothingAtDebugLevelZero) {
    CapturingLog log;
    DebugLevel level(0);
    Described::asked = 0;
    CXDLog("Mingled: %@", Described{});
    EXPECT_TRUE(log.lines().empty());
    EXPECT_EQ(Described::asked, 0);
}

TEST(Log, TheDiagnosticLogSpeaksAtAnyOtherDebugLevel) {
    CapturingLog log;
    for (int level : {1, 7, -1}) {
        DebugLevel set(level);
        CXDLog("Level %d", level);
    }
    EXPECT_EQ(log.lines(), (std::vector<std::string>{"Level 1", "Level 7", "Level -1"}));
}

TEST(Log, TheSystemLogSpeaksAtDebugLevelZero) {
    CapturingLog log;
    DebugLevel level(0);
    CXLog("Killing %@", "RolvaneManager");
    EXPECT_TRUE(log.has("Killing RolvaneManager"));
}

TEST(Log, InstallingASinkGivesBackTheFormerOne) {
    CapturingLog outer;
    {
        CapturingLog inner;
        CXLog("inner");
    }
    CXLog("outer");
    EXPECT_EQ(outer.lines(), (std::vector<std::string>{"outer"}));
}

TEST(Log, LinesOfManyThreadsAllArrive) {
    CapturingLog log;
    std::vector<std::thread> threads;
    for (int t = 0; t < 8; ++t)
        threads.emplace_back([t] {
            for (int i = 0; i < 100; ++i) CXLog("thread %d line %d", t, i);
        });
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(log.lines().size(), 800u);
    EXPECT_EQ(log.count("thread 7 line 99"), 1u);
}

TEST(LogDestination, TheJournalIsUsedWhereThereIsOneUnlessSomebodyIsWatching) {
    EXPECT_EQ(chooseLogDestination("", true, false), LogDestination::journal);
    EXPECT_EQ(chooseLogDestination("", true, true), LogDestination::standardError);
    EXPECT_EQ(chooseLogDestination("", false, false), LogDestination::standardError);
    EXPECT_EQ(chooseLogDestination("stderr", true, false), LogDestination::standardError);
    EXPECT_EQ(chooseLogDestination("journal", true, true), LogDestination::journal);
    EXPECT_EQ(chooseLogDestination("journal", false, true), LogDestination::standardError);
}

TEST(LogSinks, AJournalEntryNamesMessageKindPriorityProgramAndThread) {
    const LogEvent event = logEvent("A lock could not be renewed: %@", {{"two\nlines"}});
    EXPECT_EQ(journalFields(event, "RolvaneManager", true),
              (std::vector<std::string>{"MESSAGE=A lock could not be renewed: two\nlines",
                                        std::string("MESSAGE_ID=") + event.kind->messageId, "PRIORITY=5",
                                        "SYSLOG_IDENTIFIER=RolvaneManager", "TID=" + std::to_string(::gettid()),
                                        "ROLVANE_EVENT=lock", "ROLVANE_FORMAT=A lock could not be renewed: %@"}));
}

// What is sent to the journal for a line, joined.
std::string journalledFor(int level, const std::function<void()>& log) {
    const int former = debugLevel();
    setDebugLevel(level);
    const auto sink = LogSink::install(std::make_shared<JournalSink>());
    journalAnswer = 0;
    journalled.clear();
    log();
    LogSink::install(sink);
    setDebugLevel(former);
    std::string all;
    for (const std::string& field : journalled) all += field + "\n";
    return all;
}

TEST(LogSinks, TheJournalHearsNoNamesAtTheDefaultLevelAndAllOfThemWhenSomebodyLooks) {
    const auto log = [] { CXLog("The tree of %@ %@. %@", std::string("zoe"), "has no list", "It is left alone."); };
    EXPECT_NE(journalledFor(0, log).find("MESSAGE=The tree of … has no list. It is left alone.\n"), std::string::npos)
        << journalledFor(0, log);
    EXPECT_NE(journalledFor(1, log).find("MESSAGE=The tree of zoe has no list. It is left alone.\n"),
              std::string::npos);
    const auto unknown = [] { CXLog("Nobody has listed this: %@, %@", std::string("zoe"), 7); };
    EXPECT_EQ(journalledFor(0, unknown).find("zoe"), std::string::npos);
    const auto progress = [] { CXDLog("Entering main run loop."); };
    EXPECT_EQ(journalledFor(0, progress), "");
    EXPECT_NE(journalledFor(1, progress).find("PRIORITY=7\n"), std::string::npos);
    EXPECT_NE(journalledFor(1, progress).find("ROLVANE_EVENT=progress\n"), std::string::npos);
}

TEST(LogSinks, TheJournalGetsALineThatNothingIsKnownOf) {
    EXPECT_NE(journalledFor(0, [] { JournalSink().write("Entering main run loop."); })
                  .find("MESSAGE=Entering main run loop.\n"),
              std::string::npos);
}

TEST(LogSinks, ALineThatTheJournalRefusesGoesToStandardError) {
    journalAnswer = -ENOBUFS;
    testing::internal::CaptureStderr();
    JournalSink().write("not lost");
    EXPECT_NE(testing::internal::GetCapturedStderr().find("]: not lost\n"), std::string::npos);
}

TEST(LogSinks, AStandardErrorLineCarriesTimeProgramAndProcess) {
    std::regex form(R"(\d{4}-\d\d-\d\dT\d\d:\d\d:\d\d\.\d{6}Z program\[)" + std::to_string(::getpid()) +
                    R"(\]: hello\n)");
    EXPECT_TRUE(std::regex_match(standardErrorLine("hello", "program"), form)) << standardErrorLine("hello", "program");
}

TEST(LogSinks, NoTextCanPassItselfOffAsALineOfItsOwnOrReachTheTerminal) {
    auto line = standardErrorLine("a\n2026-01-01 forged\r\x1b[31m\x7f\tend ä", "program");
    EXPECT_NE(line.find("a\n\t2026-01-01 forged\\x0d\\x1b[31m\\x7f\tend ä\n"), std::string::npos) << line;
}

TEST(LogSinks, LinesOfSeveralThreadsDoNotMixOnStandardError) {
    int ends[2];
    ASSERT_EQ(::pipe(ends), 0);
    int former = ::dup(STDERR_FILENO);
    ::dup2(ends[1], STDERR_FILENO);
    ::close(ends[1]);
    std::string got;
    std::thread reader([&] {
        char buffer[4096];
        for (ssize_t n; (n = ::read(ends[0], buffer, sizeof buffer)) > 0;) got.append(buffer, size_t(n));
    });
    {
        StandardErrorSink sink;
        std::vector<std::thread> threads;
        for (char c : std::string("abcd"))
            threads.emplace_back([&, c] {
                for (int i = 0; i < 50; ++i) sink.write(std::string(6000, c));
            });
        for (auto& thread : threads) thread.join();
    }
    ::dup2(former, STDERR_FILENO); // closes the last writing end
    ::close(former);
    reader.join();
    ::close(ends[0]);
    size_t lines = 0;
    for (size_t at = 0, end; (end = got.find('\n', at)) != std::string::npos; at = end + 1, ++lines) {
        auto text = got.substr(got.find("]: ", at) + 3, 6000);
        ASSERT_EQ(text, std::string(6000, text[0]));
    }
    EXPECT_EQ(lines, 200u);
}
