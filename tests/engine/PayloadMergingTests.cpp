#include "engine/queue/PayloadMerging.h"

#include "Records.h"
#include "contacts/records/CXMerger.h"

#include <gtest/gtest.h>

namespace rolvane {
namespace {

using test::makeRecord;

CXDChangeRecordPtr named(const char* person, int32_t source, Value payload, int32_t appliesTo = 0) {
    return makeRecord(CXDUpdateRecord, person, nullptr, {source, appliesTo, "<self>"}, std::move(payload));
}

TEST(PayloadMerging, TheSecondCardsValuesWinAndNothingIsLost) {
    CXMerger merger;
    const Dictionary merged = payloadMerging(merger, {{"First", "Ann"}, {"Note", "kept"}}, {{"First", "Anna"}});
    EXPECT_EQ(merged, (Dictionary{{"First", "Anna"}, {"Note", "kept"}}));
}

TEST(OlderMingling, GivesARecordWithoutAddressAllOtherSources) {
    CXMerger merger;
    CXDChangeRecords none;
    EXPECT_EQ(mingleChangeAmongstChanges(merger, named("P1", 4, {}), none)->appliesToSources(), 3);
    EXPECT_EQ(mingleChangeAmongstChanges(merger, named("P1", 4, {}, 16), none)->appliesToSources(), 16);
}

TEST(OlderMingling, SwallowsTheOtherSourcesRecordOfThePerson) {
    CXMerger merger;
    const auto record = named("P1", 1, Dictionary{{"First", "Anna"}}, 4);
    const auto sameSource = named("P1", 1, Dictionary{{"First", "x"}});
    const auto otherPerson = named("P2", 4, Dictionary{{"First", "y"}});
    CXDChangeRecords changes{record, named("P1", 4, Dictionary{{"First", "Ann"}, {"Note", "n"}}), sameSource,
                             otherPerson};
    EXPECT_EQ(mingleChangeAmongstChanges(merger, record, changes), record);
    EXPECT_EQ(record->payload(), Value(Dictionary{{"First", "Anna"}, {"Note", "n"}}));
    EXPECT_EQ(record->appliesToSources(), 5);
    EXPECT_EQ(changes, (CXDChangeRecords{record, sameSource, otherPerson}));
}

TEST(OlderMingling, DoesNotLookAtTheRecordBehindASwallowedOne) {
    CXMerger merger;
    const auto record = named("P1", 1, Dictionary{}, 4);
    const auto second = named("P1", 2, Dictionary{});
    CXDChangeRecords changes{named("P1", 4, Dictionary{}), second};
    mingleChangeAmongstChanges(merger, record, changes);
    EXPECT_EQ(changes, CXDChangeRecords{second});
}

TEST(OlderMingling, RecordsWithoutAPersonAreNobodys) {
    CXMerger merger;
    const auto record = named(nullptr, 1, Dictionary{}, 4);
    CXDChangeRecords changes{named(nullptr, 4, Dictionary{})};
    mingleChangeAmongstChanges(merger, record, changes);
    EXPECT_EQ(changes.size(), 1u);
}

} // namespace
} // namespace rolvane
