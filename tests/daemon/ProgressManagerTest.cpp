#include "daemon/CXDProgressManager.h"

#include <algorithm>
#include <gtest/gtest.h>
#include <thread>
#include <vector>

namespace rolvane {
namespace {

constexpr const char* kOwn = "http://store.example/alice/Contacts";

class Locations : public RecordLocator, public LocationOwner {
public:
    std::optional<RemoteLocation> baseLocation(int32_t, const std::optional<UserName>& user) const override {
        if (!user) return std::nullopt;
        const std::string name = *user == kSelf ? "alice" : user->str();
        return RemoteLocation("http://store.example/" + name + "/Contacts");
    }
    UserName userForRemoteLocation(const RemoteLocation& location) const override {
        return location == RemoteLocation(kOwn) ? kSelf : UserName("somebody");
    }
};

CXDChangeRecordPtr recordOf(const std::optional<UserName>& user) {
    auto record =
        std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDUpdateRecord, user, UniqueId("P:CXPerson"), std::nullopt);
    record->setAppliesToSources(CXDSyncSourceVaultra);
    return record;
}

class ProgressManager : public testing::Test {
protected:
    ProgressManager() : manager(bus) { manager.setEngine(&locations, &locations); }

    // The fractions that were broadcast for a location, in order.
    std::vector<double> fractions(const std::string& location) const {
        std::vector<double> all;
        for (const Notification& n : bus.posted())
            if (n.name == "CXDSyncProgressNotification" && n.userInfo["remoteLocation"].string() == location)
                all.push_back(n.userInfo["progress"].real());
        return all;
    }
    size_t count(const std::string& name) const {
        const auto all = bus.posted();
        return static_cast<size_t>(
            std::count_if(all.begin(), all.end(), [&](const auto& n) { return n.name == name; }));
    }

    LocalNotifications bus;
    Locations locations;
    CXDProgressManager manager;
};

TEST_F(ProgressManager, ARecordThatWasNotAnnouncedPostsNothing) {
    manager.startedPhase(1);
    bus.clear();
    manager.didProcessChangeRecord(recordOf(UserName("bob")));
    EXPECT_TRUE(bus.posted().empty());
}

TEST_F(ProgressManager, ARecordThatWasNotAnnouncedIsCountedAllTheSame) {
    manager.didProcessChangeRecord(recordOf(UserName("bob")));
    manager.willProcessChangeRecord(recordOf(UserName("bob")));
    manager.didProcessChangeRecord(recordOf(UserName("bob")));
    EXPECT_EQ(fractions("http://store.example/bob/Contacts"), std::vector<double>{2.0});
}

TEST_F(ProgressManager, TheOwnersPublicationIsReportedAsLocalWhateverItsURL) {
    manager.willProcessChangeRecord(recordOf(kSelf));
    manager.didProcessChangeRecord(recordOf(kSelf));
    EXPECT_EQ(fractions("local"), std::vector<double>{1.0});
    EXPECT_TRUE(fractions(kOwn).empty());
}

TEST_F(ProgressManager, EachLocationIsCountedForItself) {
    for (int i = 0; i < 4; ++i) manager.willProcessChangeRecord(recordOf(kSelf));
    for (int i = 0; i < 2; ++i) manager.willProcessChangeRecord(recordOf(UserName("bob")));
    manager.didProcessChangeRecord(recordOf(kSelf));
    manager.didProcessChangeRecord(recordOf(UserName("bob")));
    EXPECT_EQ(fractions("local"), std::vector<double>{0.25});
    EXPECT_EQ(fractions("http://store.example/bob/Contacts"), std::vector<double>{0.5});
}

TEST_F(ProgressManager, ASecondPassAddsToTheCountsOfTheFirst) {
    manager.startedPhase(1);
    for (int i = 0; i < 2; ++i) manager.willProcessChangeRecord(recordOf(kSelf));
    for (int i = 0; i < 2; ++i) manager.didProcessChangeRecord(recordOf(kSelf));
    manager.startedPhase(1);
    for (int i = 0; i < 2; ++i) manager.willProcessChangeRecord(recordOf(kSelf));
    manager.didProcessChangeRecord(recordOf(kSelf));
    EXPECT_EQ(fractions("local"), (std::vector<double>{0.5, 1.0, 0.75}));
}

TEST_F(ProgressManager, OnlyTheFirstPhaseOfTheProcessIsAnnounced) {
    EXPECT_EQ(manager.currentPhase(), 0);
    for (int32_t phase : {1, 2, 3, 1, 2, 3}) {
        manager.startedPhase(phase);
        EXPECT_EQ(manager.currentPhase(), phase);
    }
    EXPECT_EQ(count("CXDStartedSyncingNotification"), 1U);
    EXPECT_TRUE(bus.posted().front().userInfo.empty());
}

TEST_F(ProgressManager, StoppingPostsEvenWhenNoPhaseWasEverStarted) {
    manager.stop();
    EXPECT_EQ(count("CXDStoppedSyncingNotification"), 1U);
    EXPECT_EQ(bus.posted().size(), 1U);
}

TEST_F(ProgressManager, ARecordWithoutALocationIsSkipped) {
    manager.willProcessChangeRecord(recordOf(std::nullopt));
    manager.didProcessChangeRecord(recordOf(std::nullopt));
    EXPECT_TRUE(bus.posted().empty());
}

TEST_F(ProgressManager, BeforeTheEngineIsThereRecordsAreSkipped) {
    CXDProgressManager early(bus);
    early.willProcessChangeRecord(recordOf(kSelf));
    early.didProcessChangeRecord(recordOf(kSelf));
    EXPECT_TRUE(bus.posted().empty());
}

TEST_F(ProgressManager, WorkersThatFinishAtOnceLoseNoRecord) {
    constexpr int kWorkers = 8, kEach = 200;
    for (int i = 0; i < kWorkers * kEach; ++i) manager.willProcessChangeRecord(recordOf(kSelf));
    std::vector<std::thread> workers;
    for (int w = 0; w < kWorkers; ++w)
        workers.emplace_back([&] {
            for (int i = 0; i < kEach; ++i) manager.didProcessChangeRecord(recordOf(kSelf));
        });
    for (std::thread& worker : workers) worker.join();
    std::vector<double> all = fractions("local");
    ASSERT_EQ(all.size(), static_cast<size_t>(kWorkers * kEach));
    std::sort(all.begin(), all.end());
    EXPECT_EQ(std::adjacent_find(all.begin(), all.end()), all.end()) << "two records were counted as one";
    EXPECT_EQ(all.back(), 1.0);
}

} // namespace
} // namespace rolvane
