// Replays what the fuzz target of the reports starts from and what it once found.
#include "../../fuzz/CardReportTarget.h"

#include "support/FuzzReplay.h"

namespace rolvane {
namespace {

TEST(FuzzCorpus, EveryBodyOfAReportHolds) {
    test::replayFuzzTarget(ROLVANE_SOURCE_DIR, "card_report", fuzz::checkCardReport);
}

} // namespace
} // namespace rolvane
