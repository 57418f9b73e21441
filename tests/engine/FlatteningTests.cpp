#include "engine/queue/ChangeQueue.h"

#include "Records.h"
#include "support/CpuTime.h"

#include <algorithm>
#include <gtest/gtest.h>
#include <rapidcheck/gtest.h>

namespace rolvane {
namespace {

using test::makeRecord;

// Flattening as it reads: a fold takes in every earlier change of the group, whoever's it is, and whatever it is.
class LiteralFlattening {
public:
    virtual ~LiteralFlattening() = default;
    CXDChangeRecords flat(const CXDChangeRecords& input) const {
        CXDChangeRecords result, work;
        for (const CXDChangeRecordPtr& record : input) {
            if (isNamed(*record)) {
                for (const CXDChangeRecordPtr& part : record->splitChangeRecord()) work.push_back(part);
            } else {
                work.push_back(record);
            }
        }
        while (!work.empty()) {
            const CXDChangeRecordPtr x = work.back();
            work.pop_back();
            if (!startsFold(*x)) {
                result.insert(result.begin(), x);
                continue;
            }
            auto c = std::make_shared<CXDChangeRecord>(x->initialSource(), 3, x->user(), std::nullopt, x->group());
            c->setAppliesToSources(x->appliesToSources());
            c->mergeWithGroupChangeRecord(*x);
            result.insert(result.begin(), c);
            for (size_t i = work.size(); i-- > 0;) {
                if (!takesIn(*x, *work[i])) continue;
                c->mergeWithGroupChangeRecord(*work[i]);
                work.erase(work.begin() + static_cast<std::ptrdiff_t>(i));
            }
        }
        return result;
    }

protected:
    static bool isNamed(const CXDChangeRecord& r) { return r.group() && *r.group() != UniqueId("People"); }
    virtual bool startsFold(CXDChangeRecord& x) const {
        const int32_t t = x.type();
        return x.appliesToSources() != 1 && isNamed(x) && t != 3 && t != 7 && t != 8 && t != 260 && t != 261;
    }
    virtual bool takesIn(const CXDChangeRecord& x, CXDChangeRecord& earlier) const {
        return earlier.group() == x.group();
    }
};

// The first departure: what merging refuses stands for itself. (By the letter it would end the pass.)
class WhatMergingRefusesStands : public LiteralFlattening {
protected:
    bool startsFold(CXDChangeRecord& x) const override { return LiteralFlattening::startsFold(x) && x.canBeMerged(); }
    bool takesIn(const CXDChangeRecord& x, CXDChangeRecord& earlier) const override {
        return LiteralFlattening::takesIn(x, earlier) && earlier.canBeMerged();
    }
};

// The second: a fold takes in changes of one user alone. (Every user has an all-contacts group, and all are called the
// same: by the letter one user's members would be written to another one's tree.)
class FoldsByUser : public WhatMergingRefusesStands {
    bool takesIn(const CXDChangeRecord& x, CXDChangeRecord& earlier) const override {
        return WhatMergingRefusesStands::takesIn(x, earlier) && earlier.user() == x.user();
    }
};

std::string shown(const CXDChangeRecords& records) {
    std::string text;
    for (const CXDChangeRecordPtr& r : records) {
        const std::string line = r->description();
        text += line.substr(line.find('>') + 1) + r->inMemoryPayload().description() + "\n";
    }
    return text;
}

CXDChangeRecords ofOneUser(const CXDChangeRecords& records) {
    CXDChangeRecords all;
    for (const CXDChangeRecordPtr& record : records) {
        all.push_back(std::make_shared<CXDChangeRecord>(record->initialSource(), record->type(), UserName("ann"),
                                                        record->person(), record->group(), record->payload()));
        all.back()->setAppliesToSources(record->appliesToSources());
    }
    return all;
}

RC_GTEST_PROP(Flattening, GivesWhatTheLiteralLoopGives, ()) {
    auto records = ofOneUser(*rc::gen::container<CXDChangeRecords>(test::arbitraryRecord()));
    std::erase_if(records, [](const CXDChangeRecordPtr& record) { return !record->canBeMerged(); });
    RC_ASSERT(shown(flattenGroupChanges(records)) == shown(LiteralFlattening().flat(records)));
}

RC_GTEST_PROP(Flattening, DepartsFromItWhereMergingRefuses, ()) {
    const auto records = ofOneUser(*rc::gen::container<CXDChangeRecords>(test::arbitraryRecord()));
    RC_ASSERT(shown(flattenGroupChanges(records)) == shown(WhatMergingRefusesStands().flat(records)));
}

RC_GTEST_PROP(Flattening, DepartsFromItWhereUsersMeetAndNowhereElse, ()) {
    const auto records = *rc::gen::container<CXDChangeRecords>(test::arbitraryRecord());
    RC_ASSERT(shown(flattenGroupChanges(records)) == shown(FoldsByUser().flat(records)));
}

TEST(Flattening, FoldsTheChangesOfOneGroupIntoACompositeAtTheLastOnesPlace) {
    const auto other = makeRecord(CXDUpdateRecord, "P9", nullptr);
    const CXDChangeRecords flat = flattenGroupChanges({
        makeRecord(CXDAddRecordToGroup, "P1", "G1"),
        other,
        makeRecord(CXDAddRecordToGroup, "P2", "G1"),
        makeRecord(CXDDeleteRecord, "P3", nullptr),
    });
    ASSERT_EQ(flat.size(), 3u);
    EXPECT_EQ(flat[0], other);
    EXPECT_EQ(flat[1]->type(), CXDCompositeGroupChange);
    EXPECT_EQ(flat[1]->group(), UniqueId("G1"));
    EXPECT_FALSE(flat[1]->person());
    EXPECT_EQ(flat[1]->inMemoryPayload(), Value(Dictionary{{"memberAdds", Array{"P2", "P1"}}}));
    EXPECT_EQ(flat[2]->type(), CXDDeleteRecord);
}

TEST(Flattening, ARecordForTheContactDatabaseAloneStartsNoFold) {
    const CXDChangeRecords flat = flattenGroupChanges({makeRecord(CXDAddRecordToGroup, "P1", "G1", {4, 1, "ann"}),
                                                       makeRecord(CXDAddRecordToGroup, "P2", "G1", {4, 1, "ann"})});
    ASSERT_EQ(flat.size(), 2u);
    EXPECT_EQ(flat[0]->type(), CXDAddRecordToGroup);
    EXPECT_EQ(flat[1]->person(), UniqueId("P2"));
}

TEST(Flattening, AccessListChangesDeletionsAndCompositesStartNoFold) {
    for (const int32_t type : {3, 7, 8, 260, 261}) {
        const CXDChangeRecords flat = flattenGroupChanges({makeRecord(type, "P1", "G1")});
        ASSERT_EQ(flat.size(), 1u);
        EXPECT_EQ(flat[0]->type(), type);
    }
}

TEST(Flattening, AFoldTakesInEveryEarlierChangeOfItsGroupWhateverItsTypeAndSources) {
    const CXDChangeRecords flat = flattenGroupChanges({
        makeRecord(CXDAddRecordToGroup, "P1", "G1", {4, 1, "<self>"}),
        makeRecord(CXDChangeGroupReadACL, nullptr, "G1"),
        makeRecord(CXDAddRecordToGroup, "P2", "G1"),
    });
    ASSERT_EQ(flat.size(), 1u);
    EXPECT_EQ(flat[0]->appliesToSources(), CXDSyncSourceVaultra);
    EXPECT_EQ(flat[0]->inMemoryPayload(), Value(Dictionary{{"memberAdds", Array{"P2", "P1"}}}));
}

// Every user has an all-contacts group, and all are called the same.
TEST(Flattening, TheChangesOfTwoUsersGroupsOfOneNameAreNotMixed) {
    const CXDChangeRecords flat =
        flattenGroupChanges({makeRecord(CXDAddRecordToGroup, "P1", "AllCXGroup", {1, 4, "bob"}),
                             makeRecord(CXDAddRecordToGroup, "P2", "AllCXGroup", {4, 1, "carol"}),
                             makeRecord(CXDAddRecordToGroup, "P3", "AllCXGroup", {1, 4, "<self>"})});
    ASSERT_EQ(flat.size(), 3u);
    EXPECT_EQ(flat[0]->user(), UserName("bob"));
    EXPECT_EQ(flat[0]->inMemoryPayload(), Value(Dictionary{{"memberAdds", Array{"P1"}}}));
    EXPECT_EQ(flat[1]->type(), CXDAddRecordToGroup);
    EXPECT_EQ(flat[2]->user(), kSelf);
    EXPECT_EQ(flat[2]->inMemoryPayload(), Value(Dictionary{{"memberAdds", Array{"P3"}}}));
}

TEST(Flattening, AChangeOfAllContactsPassesUnchangedWithAllItsSources) {
    const auto record = makeRecord(CXDAddRecordToGroup, "P1", "People", {1, 6, "<self>"});
    EXPECT_EQ(flattenGroupChanges({record}), CXDChangeRecords{record});
    EXPECT_EQ(record->appliesToSources(), 6);
}

TEST(Flattening, SplitsAGroupChangeIntoOneRecordASource) {
    const CXDChangeRecords flat = flattenGroupChanges({makeRecord(CXDDeleteGroup, nullptr, "G1", {1, 5, "<self>"})});
    ASSERT_EQ(flat.size(), 2u);
    EXPECT_EQ(flat[0]->appliesToSources(), 4);
    EXPECT_EQ(flat[1]->appliesToSources(), 1);
}

TEST(Flattening, WhatCannotBeMergedStandsForItselfAndStopsNobody) {
    const CXDChangeRecords flat = flattenGroupChanges(
        {makeRecord(CXDCreateStructureForGroup, nullptr, "G1"), makeRecord(CXDAddRecordToGroup, "P1", "G1")});
    ASSERT_EQ(flat.size(), 2u);
    EXPECT_EQ(flat[0]->type(), CXDCreateStructureForGroup);
    EXPECT_EQ(flat[1]->type(), CXDCompositeGroupChange);
}

TEST(Flattening, NamesTheGroupsOfWhichAFoldLosesAChange) {
    for (const int32_t lost : {3, 7, 8, 261}) {
        LostInFolds found;
        const bool isList = lost == CXDChangeGroupReadACL || lost == CXDChangeGroupReadWriteACL;
        const CXDChangeRecords flat = flattenGroupChanges(
            {makeRecord(lost, nullptr, "G1"), makeRecord(CXDRemoveRecordFromGroup, "P1", "G1"),
             makeRecord(CXDAddRecordToGroup, "P1", "G2"), makeRecord(CXDAddRecordToGroup, "P2", "G2")},
            &found);
        EXPECT_EQ(flat.size(), 2u);
        EXPECT_EQ(isList ? found.lists : found.contents, std::unordered_set<UniqueId>{UniqueId("G1")}) << lost;
        EXPECT_TRUE((isList ? found.contents : found.lists).empty()) << lost;

        found = {}; // what comes last stands for itself
        flattenGroupChanges({makeRecord(CXDRemoveRecordFromGroup, "P1", "G1"), makeRecord(lost, nullptr, "G1")},
                            &found);
        EXPECT_TRUE(found.lists.empty() && found.contents.empty()) << lost;
    }
}

TEST(Flattening, APayloadThatCannotBeReadStandsForItself) {
    const test::LogCapture log(0);
    const auto damaged = makeRecord(CXDChangeGroupName, nullptr, "G1");
    damaged->setEncodedPayload(std::make_shared<const Bytes>(Bytes{0xff}));
    const CXDChangeRecords flat = flattenGroupChanges({damaged, makeRecord(CXDAddRecordToGroup, "P1", "G1")});
    ASSERT_EQ(flat.size(), 2u);
    EXPECT_EQ(flat[0]->type(), CXDChangeGroupName);
    EXPECT_TRUE(log.has("Exception with reading change record: "));
}

// Compared with itself at a tenth of the size; a walk for each change would cost a hundred times as much.
TEST(Flattening, OneLargeGroupCostsInProportionToItsChanges) {
    const auto seconds = [](size_t members) {
        CXDChangeRecords records;
        for (size_t i = 0; i < members; ++i)
            records.push_back(makeRecord(CXDAddRecordToGroup, ("P" + std::to_string(i)).c_str(), "G1"));
        return test::leastCpuSeconds([&](const auto& start) {
            start();
            EXPECT_EQ(flattenGroupChanges(records).size(), 1u);
        });
    };
    const double small = std::max(seconds(2000), 1e-4);
    EXPECT_LT(seconds(20000), 40 * small);
}

RC_GTEST_PROP(Flattening, SortingByTypeIsTheStableSortOfTheComparison, ()) {
    auto records = *rc::gen::container<CXDChangeRecords>(test::arbitraryRecord());
    CXDChangeRecords expected = records;
    std::stable_sort(expected.begin(), expected.end(),
                     [](const CXDChangeRecordPtr& a, const CXDChangeRecordPtr& b) { return a->compare(*b) < 0; });
    sortByType(records);
    RC_ASSERT(test::identities(records) == test::identities(expected));
}

} // namespace
} // namespace rolvane
