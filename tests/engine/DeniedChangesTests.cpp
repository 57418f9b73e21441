#include "engine/queue/DeniedChanges.h"

#include "Records.h"

#include <gtest/gtest.h>
#include <thread>

namespace rolvane {
namespace {

using test::makeRecord;

TEST(DeniedSet, TakesInTheRecordAndEveryRecordOfItsUser) {
    DeniedChanges denied;
    const auto first = makeRecord(CXDUpdateRecord, "P1", nullptr, {1, 4, "ann"});
    const auto same = makeRecord(CXDUpdateRecord, "P2", nullptr, {1, 4, "ann"});
    const auto other = makeRecord(CXDUpdateRecord, "P3", nullptr, {1, 4, "bob"});
    EXPECT_FALSE(denied.contains(*first));
    denied.cancelLike(first, {same, other});
    EXPECT_TRUE(denied.contains(*first));
    EXPECT_TRUE(denied.contains(*same));
    EXPECT_FALSE(denied.contains(*other));
    EXPECT_EQ(denied.all().size(), 2u);
    denied.clear();
    EXPECT_TRUE(denied.empty());
    EXPECT_FALSE(denied.contains(*first));
}

TEST(DeniedSet, ARecordWithoutAUserIsLikeNoOther) {
    DeniedChanges denied;
    const auto first = makeRecord(CXDUpdateRecord, "P1", nullptr, {1, 4, nullptr});
    const auto second = makeRecord(CXDUpdateRecord, "P2", nullptr, {1, 4, nullptr});
    denied.cancelLike(first, {first, second});
    EXPECT_TRUE(denied.contains(*first));
    EXPECT_FALSE(denied.contains(*second));
}

TEST(DeniedSet, AsksByRecordEquality) {
    DeniedChanges denied;
    denied.add(makeRecord(CXDUpdateRecord, "P1", "G1"));
    EXPECT_TRUE(denied.contains(*makeRecord(CXDUpdateRecord, "P1", "G1", {}, "another payload")));
    EXPECT_FALSE(denied.contains(*makeRecord(CXDUpdateRecord, "P1", "G1", {1, 5, "<self>"})));
}

TEST(DeniedSet, FindsARecordWhoseMaskHasChangedSince) {
    DeniedChanges denied;
    const auto record = makeRecord(CXDUpdateRecord, "P1", nullptr, {1, 5, "<self>"});
    denied.add(record);
    record->setAppliesToSources(4);
    EXPECT_TRUE(denied.contains(*record));
}

TEST(DeniedSet, IsSharedByThreads) {
    DeniedChanges denied;
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t)
        threads.emplace_back([&denied, t] {
            for (int i = 0; i < 200; ++i) {
                const auto record = makeRecord(CXDUpdateRecord, std::to_string(t * 1000 + i).c_str(), nullptr);
                denied.cancelLike(record, {});
                EXPECT_TRUE(denied.contains(*record));
            }
        });
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(denied.all().size(), 800u);
}

} // namespace
} // namespace rolvane
