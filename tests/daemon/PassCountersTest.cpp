#include "daemon/PassCounters.h"

#include "DaemonWorld.h"

#include "foundation/Paths.h"
#include "support/CapturingLog.h"

#include <gmock/gmock.h>
#include <regex>
#include <sstream>

namespace rolvane::test {
namespace {

using testing::HasSubstr;

PassOutcome pass(double began, double seconds, int64_t out, int64_t in, int64_t waiting) {
    PassOutcome outcome;
    outcome.began = Date(began);
    outcome.ended = Date(began + seconds);
    outcome.full = true;
    outcome.storeReached = true;
    PassTree own, other;
    own.user = kSelf;
    own.out.carried = out;
    own.out.waiting = waiting;
    own.out.refused = 1;
    other.user = UserName("zoe");
    other.location = "https://dav.example.org/zoe/Contacts";
    other.in.carried = in;
    outcome.trees = {own, other};
    return outcome;
}

TEST(PassCounters, AddUpWhatThePassesHaveDone) {
    const TempDirectory directory;
    PassCounters counters(directory / "metrics.prom", Date(1000));
    counters.passEnded(pass(2000, 1.5, 7, 3, 4));
    PassOutcome small = pass(3000, 0.5, 1, 0, 0);
    small.full = small.storeReached = false;
    small.exception = "\"Zoe\" cannot be read";
    counters.passEnded(small);
    const std::string text = readFile(directory / "metrics.prom");
    for (const char* line :
         {"rolvane_passes_total{kind=\"full\"} 1\n", "rolvane_passes_total{kind=\"small\"} 1\n",
          "rolvane_passes_incomplete_total 1\n", "rolvane_passes_without_store_total 1\n",
          "rolvane_changes_total{direction=\"out\"} 8\n", "rolvane_changes_total{direction=\"in\"} 3\n",
          "rolvane_changes_refused_total{direction=\"out\"} 2\n", "rolvane_changes_waiting{direction=\"out\"} 0\n",
          "rolvane_store_reached 0\n", "rolvane_everything_sent 0\n", "rolvane_last_pass_timestamp_seconds 3000.5\n",
          "rolvane_last_pass_duration_seconds 0.5\n", "rolvane_start_time_seconds 1000\n"})
        EXPECT_THAT(text, HasSubstr(line));
    EXPECT_EQ(text.find("zoe"), std::string::npos);
    EXPECT_EQ(text.find("Zoe"), std::string::npos);
}

// One head for each name, then its samples.
TEST(PassCounters, AreWrittenAsPrometheusReadsThem) {
    std::istringstream lines(PassCounters("/nowhere/metrics.prom", Date(1000)).text());
    const std::regex sample("(rolvane_[a-z_]+)(\\{[a-z]+=\"[a-z]+\"\\})? [0-9.e+-]+"),
        head("# (HELP|TYPE) (rolvane_[a-z_]+) .+");
    std::string announced;
    size_t samples = 0;
    for (std::string line; std::getline(lines, line);) {
        std::smatch found;
        if (std::regex_match(line, found, head)) {
            announced = found[2];
            continue;
        }
        ASSERT_TRUE(std::regex_match(line, found, sample)) << line;
        EXPECT_EQ(found[1], announced) << "a sample stands below its own head";
        ++samples;
    }
    EXPECT_GT(samples, 12U);
}

TEST(PassCounters, ThatCannotBeWrittenAreToldOnce) {
    CapturingLog log;
    PassCounters counters("/nowhere/metrics.prom", Date(1000));
    for (int i = 0; i < 3; ++i) counters.passEnded(pass(2000, 1, 1, 1, 1));
    EXPECT_EQ(log.lines().size(), 1U);
}

TEST(PassCounters, AreThereWhenTheDaemonHasMadeItsPass) {
    DaemonWorld world;
    world.saveAccountOn(world.store());
    world.addPeople(3);
    world.publishEverything();
    const auto daemon = world.serving();
    const std::string text = readFile(world.home / "state/rolvane/metrics.prom");
    EXPECT_THAT(text, HasSubstr("rolvane_everything_sent 1\n"));
    EXPECT_TRUE(std::regex_search(text, std::regex("rolvane_changes_total\\{direction=\"out\"\\} [1-9]"))) << text;
}

} // namespace
} // namespace rolvane::test
