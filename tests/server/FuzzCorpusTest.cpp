// Replays what the fuzz targets of mod_davacl start from and what they once found.
#include "../../fuzz/AccessListsTarget.h"
#include "../../fuzz/AclBodyTarget.h"
#include "../../fuzz/ReportBodyTarget.h"

#include "support/FuzzReplay.h"

namespace rolvane {
namespace {

TEST(FuzzCorpus, EveryFileOfAccessListsHolds) {
    test::replayFuzzTarget(ROLVANE_SOURCE_DIR, "access_lists", fuzz::checkAccessLists);
}

TEST(FuzzCorpus, EveryBodyOfAnAclRequestHolds) {
    test::replayFuzzTarget(ROLVANE_SOURCE_DIR, "acl_body", fuzz::checkAclBody);
}

TEST(FuzzCorpus, EveryBodyOfAReportHolds) {
    test::replayFuzzTarget(ROLVANE_SOURCE_DIR, "report_body", fuzz::checkReportBody);
}

} // namespace
} // namespace rolvane
