#include "engine/Mingler.h"

#include "Records.h"
#include "support/CpuTime.h"

#include <algorithm>
#include <gtest/gtest.h>
#include <map>
#include <rapidcheck/gtest.h>

namespace rolvane {
namespace {

using test::LogCapture;
using test::makeRecord;

// Mingling as it reads: every bucket is walked from its last element to its first.
class LiteralMingler {
public:
    CXDChangeRecords mingled;
    bool mingle(const CXDChangeRecordPtr& record) {
        bool accepted = false;
        if (record->person()) accepted = intoBucket(record, buckets[*record->person()]);
        if (record->group()) accepted = intoBucket(record, buckets[*record->group()]) || accepted;
        if (accepted) mingled.push_back(record);
        return accepted;
    }

private:
    std::map<UniqueId, CXDChangeRecords> buckets;

    static void removeEqual(CXDChangeRecords& list, const CXDChangeRecordPtr& record) {
        std::erase_if(list, [&](const CXDChangeRecordPtr& each) { return each->isEqual(*record); });
    }
    // The owner's own changes: `r` is the one that takes away.
    static bool undoes(const CXDChangeRecord& r, const CXDChangeRecord& other) {
        const bool leaves = (r.type() == 258 || r.type() == 259) && r.group() == UniqueId("AllCXGroup");
        return r.group() == other.group() || r.type() == 260 || leaves;
    }
    bool intoBucket(const CXDChangeRecordPtr& n, CXDChangeRecords& bucket) {
        bool keep = true;
        for (size_t i = bucket.size(); keep && i-- > 0;) {
            const CXDChangeRecordPtr e = bucket[i];
            if (e->isEqual(*n)) return false;
            const bool levels = (n->type() & 0x100) != (e->type() & 0x100);
            const CXDChangeRecordPtr& removal = n->type() & 0x100 ? n : e;
            const bool owners = n->changeMadeByDataOwner() && e->changeMadeByDataOwner();
            if (n->person() && e->person() && *n->person() == *e->person() && levels &&
                (!owners || undoes(*removal, removal == n ? *e : *n))) {
                CXDLog("Possible conflict:\n\t%@\n\t%@", n, e);
                if (n->changeMadeByDataOwner()) {
                    CXDLog("Rejecting %@", e);
                    removeEqual(bucket, e);
                    removeEqual(mingled, e);
                } else if (e->changeMadeByDataOwner()) {
                    CXDLog("Rejecting %@", n);
                    keep = false;
                }
            }
            if (n->group() && e->group() && *n->group() == *e->group() && n->type() != 9 && e->type() != 9 && levels &&
                (!owners || removal->type() == 261)) {
                CXDLog("Possible conflict:\n\t%@\n\t%@", n, e);
                if (n->changeMadeByDataOwner()) {
                    removeEqual(bucket, e);
                    removeEqual(mingled, e);
                } else if (e->changeMadeByDataOwner()) {
                    keep = false;
                }
            }
        }
        if (keep) bucket.push_back(n);
        return keep;
    }
};

struct Run {
    std::vector<bool> accepted;
    std::vector<const CXDChangeRecord*> mingled;
    std::vector<std::string> log;
};

template <class M>
Run runOf(M& mingler, const CXDChangeRecords& records, int level) {
    const LogCapture log(level);
    Run run;
    for (const CXDChangeRecordPtr& record : records) run.accepted.push_back(mingler.mingle(record));
    if constexpr (std::is_same_v<M, Mingler>)
        run.mingled = test::identities(mingler.takeMingled());
    else
        run.mingled = test::identities(mingler.mingled);
    run.log = log.lines();
    return run;
}

RC_GTEST_PROP(Mingling, GivesWhatTheLiteralWalkGivesWithTheSameLog, ()) {
    const auto records = *rc::gen::container<CXDChangeRecords>(test::arbitraryRecord());
    const auto indexFrom = *rc::gen::inRange<size_t>(0, 12);
    LiteralMingler literal;
    const Run expected = runOf(literal, records, 1);
    Mingler logging(indexFrom);
    const Run logged = runOf(logging, records, 1);
    RC_ASSERT(logged.accepted == expected.accepted);
    RC_ASSERT(logged.mingled == expected.mingled);
    RC_ASSERT(logged.log == expected.log);
    Mingler silent(indexFrom);
    const Run quiet = runOf(silent, records, 0);
    RC_ASSERT(quiet.accepted == expected.accepted);
    RC_ASSERT(quiet.mingled == expected.mingled);
    RC_ASSERT(quiet.log.empty());
    Mingler atOnce(indexFrom);
    atOnce.mingle(records);
    RC_ASSERT(test::identities(atOnce.takeMingled()) == expected.mingled);
}

TEST(Mingling, TheSameRecordNewAndCarriedOverEndsUpOnce) {
    Mingler mingler;
    const auto first = makeRecord(CXDUpdateRecord, "P1", nullptr);
    EXPECT_TRUE(mingler.mingle(first));
    EXPECT_FALSE(mingler.mingle(makeRecord(CXDUpdateRecord, "P1", nullptr)));
    EXPECT_EQ(test::identities(mingler.takeMingled()), std::vector<const CXDChangeRecord*>{first.get()});
}

TEST(Mingling, ARecordWithPersonAndGroupIsAcceptedWhenEitherBucketAcceptsIt) {
    Mingler mingler;
    const auto removal = makeRecord(CXDRemoveRecordFromGroup, "P1", "G9");
    const auto theirs = makeRecord(CXDAddRecordToGroup, "P1", "G1", {CXDSyncSourceVaultra, 1, "ann"});
    EXPECT_TRUE(mingler.mingle(removal));
    EXPECT_TRUE(mingler.mingle(theirs)) << "the person's bucket rejects it, the group's does not know the removal";
    EXPECT_EQ(mingler.takeMingled().size(), 2u);
}

TEST(Mingling, ASubscribersUpdateLosesAgainstTheOwnersRemovalOfTheSameContact) {
    const LogCapture log;
    Mingler mingler;
    const auto owners = makeRecord(CXDRemoveRecordFromGroup, "P1", "G1");
    const auto theirs = makeRecord(CXDUpdateRecord, "P1", nullptr, {CXDSyncSourceVaultra, 1, "ann"});
    EXPECT_TRUE(mingler.mingle(owners));
    EXPECT_FALSE(mingler.mingle(theirs));
    EXPECT_EQ(log.lines(), (std::vector<std::string>{"Possible conflict:\n\t" + theirs->description() + "\n\t" +
                                                         owners->description(),
                                                     "Rejecting " + theirs->description()}));
}

TEST(Mingling, TheOwnersLaterChangeTakesASubscribersEarlierOneOut) {
    const LogCapture log;
    Mingler mingler;
    const auto theirs = makeRecord(CXDUpdateRecord, "P1", nullptr, {CXDSyncSourceVaultra, 1, "ann"});
    const auto owners = makeRecord(CXDDeleteRecord, "P1", nullptr);
    EXPECT_TRUE(mingler.mingle(theirs));
    EXPECT_TRUE(mingler.mingle(owners));
    EXPECT_EQ(test::identities(mingler.takeMingled()), std::vector<const CXDChangeRecord*>{owners.get()});
    EXPECT_TRUE(log.has("Rejecting " + theirs->description()));
}

TEST(Mingling, AGroupConflictIsLoggedWithoutSayingWhoIsRejected) {
    const LogCapture log;
    Mingler mingler;
    const auto owners = makeRecord(CXDDeleteGroup, nullptr, "G1");
    const auto theirs = makeRecord(CXDAddRecordToGroup, nullptr, "G1", {CXDSyncSourceVaultra, 1, "ann"});
    EXPECT_TRUE(mingler.mingle(owners));
    EXPECT_FALSE(mingler.mingle(theirs));
    EXPECT_TRUE(log.has("Possible conflict:"));
    EXPECT_FALSE(log.has("Rejecting"));
}

TEST(Mingling, ADistributionListChangeNeverContradictsAGroupsRemoval) {
    Mingler mingler;
    EXPECT_TRUE(mingler.mingle(makeRecord(CXDDeleteGroup, nullptr, "G1")));
    EXPECT_TRUE(mingler.mingle(makeRecord(CXDUpdateDistributionList, nullptr, "G1", {4, 1, "ann"})));
}

TEST(Mingling, TwoSubscribersNeverRejectEachOther) {
    Mingler mingler;
    EXPECT_TRUE(mingler.mingle(makeRecord(CXDDeleteRecord, "P1", nullptr, {4, 1, "ann"})));
    EXPECT_TRUE(mingler.mingle(makeRecord(CXDUpdateRecord, "P1", nullptr, {4, 1, "bob"})));
}

TEST(Mingling, WhatTheOwnerChangesInOneGroupAtATimeIsAllKept) {
    Mingler mingler;
    const CXDChangeRecords records{
        makeRecord(CXDAddRecordToGroup, "P1", "G1"), makeRecord(CXDRemoveRecordFromGroup, "P2", "G1"),
        makeRecord(CXDChangeGroupName, nullptr, "G1"), makeRecord(CXDRemoveGroupFromGroup, "G3", "G1")};
    for (const auto& record : records) EXPECT_TRUE(mingler.mingle(record));
    EXPECT_EQ(test::identities(mingler.takeMingled()), test::identities(records));
}

TEST(Mingling, AnEditOfAPersonWhoMovesFromOneGroupToAnotherIsKeptWithBothSteps) {
    Mingler mingler;
    const CXDChangeRecords records{makeRecord(CXDUpdateRecord, "P1", nullptr),
                                   makeRecord(CXDRemoveRecordFromGroup, "P1", "G1"),
                                   makeRecord(CXDAddRecordToGroup, "P1", "G2")};
    for (const auto& record : records) EXPECT_TRUE(mingler.mingle(record));
    EXPECT_EQ(test::identities(mingler.takeMingled()), test::identities(records));
}

TEST(Mingling, TheOwnersLaterChangeWinsWhereItUndoesTheEarlier) {
    const auto left = [](const CXDChangeRecordPtr& first, const CXDChangeRecordPtr& second) {
        Mingler mingler;
        mingler.mingle(first);
        mingler.mingle(second);
        return test::identities(mingler.takeMingled()) == std::vector<const CXDChangeRecord*>{second.get()};
    };
    EXPECT_TRUE(left(makeRecord(CXDAddRecordToGroup, "P1", "G1"), makeRecord(CXDRemoveRecordFromGroup, "P1", "G1")));
    EXPECT_TRUE(left(makeRecord(CXDRemoveRecordFromGroup, "P1", "G1"), makeRecord(CXDAddRecordToGroup, "P1", "G1")));
    EXPECT_TRUE(
        left(makeRecord(CXDUpdateRecord, "P1", nullptr), makeRecord(CXDRemoveRecordFromGroup, "P1", "AllCXGroup")));
    EXPECT_TRUE(
        left(makeRecord(CXDRemoveRecordFromGroup, "P1", "AllCXGroup"), makeRecord(CXDUpdateRecord, "P1", nullptr)));
    EXPECT_TRUE(left(makeRecord(CXDAddRecordToGroup, "P1", "G1"), makeRecord(CXDDeleteGroup, nullptr, "G1")));
    EXPECT_TRUE(left(makeRecord(CXDUpdateRecord, "P1", nullptr), makeRecord(CXDDeleteRecord, "P1", nullptr)));
}

TEST(Mingling, ARecordWithNeitherIdentifierIsDropped) {
    Mingler mingler;
    EXPECT_FALSE(mingler.mingle(makeRecord(CXDUpdateRecord, nullptr, nullptr)));
    EXPECT_TRUE(mingler.takeMingled().empty());
}

// A hundred thousand members of one group meet in one bucket. Compared with itself at a tenth of the size, so that the
// machine's speed does not matter; a walk of the bucket would cost a hundred times as much.
TEST(Mingling, OneLargeGroupCostsInProportionToItsChanges) {
    const auto seconds = [](size_t members, const char* user) {
        CXDChangeRecords records;
        for (size_t i = 0; i < members; ++i)
            records.push_back(makeRecord(i % 2 ? CXDAddRecordToGroup : CXDRemoveRecordFromGroup,
                                         ("P" + std::to_string(i)).c_str(), "G1", {4, 1, user}));
        return test::leastCpuSeconds([&](const auto& start) {
            start();
            Mingler mingler;
            for (const auto& record : records) mingler.mingle(record);
            EXPECT_EQ(mingler.takeMingled().size(), members);
        });
    };
    for (const char* user : {"ann", "<self>"}) {
        const double small = std::max(seconds(2000, user), 1e-4);
        EXPECT_LT(seconds(20000, user), 40 * small) << user;
    }
}

} // namespace
} // namespace rolvane
