// Replays what the fuzz targets start from and what they once found.
#include "../../fuzz/AddressTarget.h"
#include "../../fuzz/KeyedArchiveTarget.h"
#include "../../fuzz/PropertyListTarget.h"

#include "support/FuzzReplay.h"

namespace rolvane {
namespace {

TEST(FuzzCorpusTest, EveryPropertyListInputHolds) {
    test::replayFuzzTarget(ROLVANE_SOURCE_DIR, "property_list", fuzz::checkPropertyList);
}

TEST(FuzzCorpusTest, EveryKeyedArchiveInputHolds) {
    test::replayFuzzTarget(ROLVANE_SOURCE_DIR, "keyed_archive", fuzz::checkKeyedArchive);
}

TEST(FuzzCorpusTest, EveryAddressHolds) {
    test::replayFuzzTarget(ROLVANE_SOURCE_DIR, "address", fuzz::checkAddress);
}

} // namespace
} // namespace rolvane
