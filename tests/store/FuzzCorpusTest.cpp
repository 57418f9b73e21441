// Replays what the fuzz targets of the store's answers start from and what they once found.
#include "../../fuzz/AnswerHeadTarget.h"
#include "../../fuzz/StoreXmlTarget.h"

#include "support/FuzzReplay.h"

namespace rolvane {
namespace {

TEST(FuzzCorpus, EveryXmlOfAStoreHolds) {
    test::replayFuzzTarget(ROLVANE_SOURCE_DIR, "store_xml", fuzz::checkStoreXml);
}

TEST(FuzzCorpus, EveryAnswerOfAStoreHolds) {
    test::replayFuzzTarget(ROLVANE_SOURCE_DIR, "answer_head", fuzz::checkAnswerHead);
}

} // namespace
} // namespace rolvane
