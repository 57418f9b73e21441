#include "engine/queue/Mingler.h"

#include "Records.h"

#include <algorithm>
#include <cstdint>
#include <gtest/gtest.h>
#include <map>
#include <rapidcheck/gtest.h>

namespace rolvane {
namespace {

using test::LogCapture;
using test::makeRecord;

// Mingling as it reads, without any exception: every bucket is walked from its last element to its first, and the owner
// wins wherever one record takes away and the other does not, against whomever.
class LiteralMingler {
public:
    virtual ~LiteralMingler() = default;
    CXDChangeRecords mingled;
    bool mingle(const CXDChangeRecordPtr& record) {
        bool accepted = false;
        if (record->person()) accepted = intoBucket(record, buckets[*record->person()]);
        if (record->group()) accepted = intoBucket(record, buckets[*record->group()]) || accepted;
        if (accepted) mingled.push_back(record);
        return accepted;
    }

protected:
    static bool differInLevel(const CXDChangeRecord& n, const CXDChangeRecord& e) {
        return (n.type() & 0x100) != (e.type() & 0x100);
    }
    virtual bool contradictInPerson(const CXDChangeRecord& n, const CXDChangeRecord& e) const {
        return n.person() && e.person() && *n.person() == *e.person() && differInLevel(n, e);
    }
    virtual bool contradictInGroup(const CXDChangeRecord& n, const CXDChangeRecord& e) const {
        return n.group() && e.group() && *n.group() == *e.group() && n.type() != 9 && e.type() != 9 &&
               differInLevel(n, e);
    }

private:
    std::map<UniqueId, CXDChangeRecords> buckets;

    static void removeEqual(CXDChangeRecords& list, const CXDChangeRecordPtr& record) {
        std::erase_if(list, [&](const CXDChangeRecordPtr& each) { return each->isEqual(*record); });
    }
    bool intoBucket(const CXDChangeRecordPtr& n, CXDChangeRecords& bucket) {
        bool keep = true;
        for (size_t i = bucket.size(); keep && i-- > 0;) {
            const CXDChangeRecordPtr e = bucket[i];
            if (e->isEqual(*n)) return false;
            if (contradictInPerson(*n, *e)) {
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
            if (contradictInGroup(*n, *e)) {
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

// The departure: two changes of the owner's stand side by side unless the later one undoes the earlier. (By the letter
// somebody's joining a group would be lost to somebody else's leaving it in the same save.)
class OwnersChangesSideBySide : public LiteralMingler {
    static bool areOwnersBoth(const CXDChangeRecord& n, const CXDChangeRecord& e) {
        return n.changeMadeByDataOwner() && e.changeMadeByDataOwner();
    }
    static const CXDChangeRecord& removalOf(const CXDChangeRecord& n, const CXDChangeRecord& e) {
        return n.type() & 0x100 ? n : e;
    }
    bool contradictInPerson(const CXDChangeRecord& n, const CXDChangeRecord& e) const override {
        if (!LiteralMingler::contradictInPerson(n, e)) return false;
        const CXDChangeRecord& removal = removalOf(n, e);
        const bool leaves =
            (removal.type() == 258 || removal.type() == 259) && removal.group() == UniqueId("AllCXGroup");
        return !areOwnersBoth(n, e) || n.group() == e.group() || removal.type() == 260 || leaves;
    }
    bool contradictInGroup(const CXDChangeRecord& n, const CXDChangeRecord& e) const override {
        return LiteralMingler::contradictInGroup(n, e) && (!areOwnersBoth(n, e) || removalOf(n, e).type() == 261);
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

template <class Literal>
void expectSame(const CXDChangeRecords& records, size_t indexFrom) {
    Literal literal;
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

// Where the owner's changes do not meet each other: all of them take away, or none does.
RC_GTEST_PROP(Mingling, GivesWhatTheLiteralWalkGivesWithTheSameLog, ()) {
    auto records = *rc::gen::container<CXDChangeRecords>(test::arbitraryRecord());
    const int32_t ownersLevel = *rc::gen::elementOf(std::vector<int32_t>{0, 0x100});
    for (CXDChangeRecordPtr& record : records)
        if (record->changeMadeByDataOwner() && (record->type() & 0x100) != ownersLevel) {
            auto others = std::make_shared<CXDChangeRecord>(record->initialSource(), record->type(), UserName("ann"),
                                                            record->person(), record->group());
            others->setAppliesToSources(record->appliesToSources());
            record = others;
        }
    expectSame<LiteralMingler>(records, *rc::gen::inRange<size_t>(0, 12));
}

RC_GTEST_PROP(Mingling, DepartsFromItWhereTheOwnersChangesMeetAndNowhereElse, ()) {
    const auto records = *rc::gen::container<CXDChangeRecords>(test::arbitraryRecord());
    expectSame<OwnersChangesSideBySide>(records, *rc::gen::inRange<size_t>(0, 12));
}

TEST(Mingling, ByTheLetterAnOwnersLaterChangeWouldTakeOutAnother) {
    const CXDChangeRecords records{makeRecord(CXDAddRecordToGroup, "P1", "G1"),
                                   makeRecord(CXDRemoveRecordFromGroup, "P2", "G1")};
    LiteralMingler literal;
    Mingler mingler;
    for (const auto& record : records) {
        literal.mingle(record);
        mingler.mingle(record);
    }
    EXPECT_EQ(test::identities(literal.mingled), std::vector<const CXDChangeRecord*>{records[1].get()});
    EXPECT_EQ(test::identities(mingler.takeMingled()), test::identities(records));
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

// All members of one group meet in one bucket. A walk of the bucket for each would look at millions.
TEST(Mingling, OneLargeGroupCostsInProportionToItsChanges) {
    constexpr size_t kMembers = 20000;
    for (const char* user : {"ann", "<self>"}) {
        Mingler mingler;
        for (size_t i = 0; i < kMembers; ++i)
            mingler.mingle(makeRecord(i % 2 ? CXDAddRecordToGroup : CXDRemoveRecordFromGroup,
                                      ("P" + std::to_string(i)).c_str(), "G1", {4, 1, user}));
        EXPECT_GT(mingler.elementsLookedAt(), 0U);
        EXPECT_LT(mingler.elementsLookedAt(), 4 * kMembers) << user;
        EXPECT_EQ(mingler.takeMingled().size(), kMembers);
    }
    Mingler walking(SIZE_MAX); // without an index: so that the count is known to count
    for (size_t i = 0; i < 100; ++i)
        walking.mingle(makeRecord(CXDAddRecordToGroup, ("P" + std::to_string(i)).c_str(), "G1"));
    EXPECT_EQ(walking.elementsLookedAt(), 100U * 99 / 2);
}

} // namespace
} // namespace rolvane
