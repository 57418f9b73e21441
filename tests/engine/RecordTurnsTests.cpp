#include "engine/pass/RecordTurns.h"

#include "Records.h"
#include "engine/queue/ChangeQueue.h"

#include <atomic>
#include <gtest/gtest.h>
#include <thread>

namespace rolvane::test {
namespace {

constexpr const char* kEverybody = "AllCXGroup";

CXDChangeRecordPtr of(const char* user, int32_t type, const char* person, const char* group) {
    return makeRecord(type, person, group, {CXDSyncSourceCX, CXDSyncSourceVaultra, user});
}

// Time enough for another thread to go wrong; right ones do not depend on it.
void letOthersRun() {
    for (int i = 0; i < 20000; ++i) std::this_thread::yield();
}

TEST(RecordTurns, AListOfEverybodyWaitsForContactsAndOtherGroupsForTheList) {
    const CXDChangeRecords records{of("bob", CXDUpdateRecord, "A:CXPerson", nullptr),
                                   of("bob", CXDUpdateRecord, "B:CXPerson", nullptr),
                                   of("bob", CXDCompositeGroupChange, nullptr, kEverybody),
                                   of("bob", CXDCompositeGroupChange, nullptr, "G:CXGroup")};
    RecordTurns turns(records, [](const UserName&) { return true; });
    std::atomic<bool> list = false, group = false;
    const auto work = [&](size_t record, std::atomic<bool>& begun) {
        turns.await(*records[record]);
        begun = true;
    };
    std::thread first(work, 2, std::ref(list)), second(work, 3, std::ref(group));
    letOthersRun();
    EXPECT_FALSE(list || group);
    turns.done(*records[1]);
    letOthersRun();
    EXPECT_FALSE(list || group);
    turns.done(*records[0]);
    first.join();
    EXPECT_TRUE(list);
    letOthersRun();
    EXPECT_FALSE(group);
    turns.done(*records[2]);
    second.join();
    EXPECT_TRUE(group);
}

// One is new, and one has waited since an earlier pass.
TEST(RecordTurns, AGroupWaitsForEachListOfEverybodyInFrontOfIt) {
    const CXDChangeRecords records{of("bob", CXDCompositeGroupChange, nullptr, kEverybody),
                                   of("bob", CXDCompositeGroupChange, nullptr, kEverybody),
                                   of("bob", CXDCompositeGroupChange, nullptr, "G:CXGroup"),
                                   of("bob", CXDCompositeGroupChange, nullptr, kEverybody)};
    RecordTurns turns(records, [](const UserName&) { return true; });
    std::atomic<bool> group = false;
    std::thread other([&] {
        turns.await(*records[2]);
        group = true;
    });
    turns.await(*records[0]);
    turns.done(*records[0]);
    letOthersRun();
    EXPECT_FALSE(group);
    turns.await(*records[1]);
    turns.done(*records[1]);
    other.join();
    EXPECT_TRUE(group);
}

// Somebody who works alone takes them in the order of the list.
TEST(RecordTurns, AGroupInFrontOfTheListWaitsForNothing) {
    const CXDChangeRecords records{of("bob", CXDCompositeGroupChange, nullptr, "G:CXGroup"),
                                   of("bob", CXDCompositeGroupChange, nullptr, kEverybody)};
    RecordTurns turns(records, [](const UserName&) { return true; });
    for (const CXDChangeRecordPtr& record : records) {
        turns.await(*record);
        turns.done(*record);
    }
}

TEST(RecordTurns, NothingWaitsForTheContactsOfAnotherTreeOrWhereNobodyElseMayWrite) {
    const CXDChangeRecords records{of("bob", CXDUpdateRecord, "A:CXPerson", nullptr),
                                   of("bob", CXDCompositeGroupChange, nullptr, kEverybody),
                                   of("carol", CXDCompositeGroupChange, nullptr, kEverybody)};
    RecordTurns(records, [](const UserName&) { return false; }).await(*records[1]);
    RecordTurns(records).await(*records[1]);
    RecordTurns(records, [](const UserName&) { return true; }).await(*records[2]); // or this test would not end
}

TEST(RecordTurns, ListsOfEverybodyGoBeforeTheOtherGroups) {
    CXDChangeRecords records{of("bob", CXDUpdateRecord, "A:CXPerson", nullptr),
                             of("bob", CXDCompositeGroupChange, nullptr, "G:CXGroup"),
                             of("<self>", CXDCompositeGroupChange, nullptr, kEverybody),
                             of("bob", CXDCompositeGroupChange, nullptr, kEverybody),
                             of("<self>", CXDCompositeGroupChange, nullptr, "H:CXGroup"),
                             of("bob", CXDDeleteGroup, nullptr, "I:CXGroup")};
    const CXDChangeRecords before = records;
    putListsOfEverybodyFirst(records);
    EXPECT_EQ(records, (CXDChangeRecords{before[0], before[2], before[3], before[1], before[4], before[5]}));
    CXDChangeRecords none{before[0], before[5]};
    putListsOfEverybodyFirst(none);
    EXPECT_EQ(none, (CXDChangeRecords{before[0], before[5]}));
}

} // namespace
} // namespace rolvane::test
