#include "DaemonWorld.h"

#include "foundation/BusConnection.h"
#include "foundation/Paths.h"
#include "foundation/RunLoop.h"
#include "support/WaitUntil.h"

#include <sstream>

// What other programs can bring about over the session bus: see docs/threat-model.md.

namespace rolvane::test {
namespace {

long peakMegabytes(pid_t pid) {
    std::istringstream lines(readFile("/proc/" + std::to_string(pid) + "/status"));
    for (std::string line; std::getline(lines, line);)
        if (line.starts_with("VmHWM:")) return std::atol(line.c_str() + 6) / 1024;
    return 0;
}

class BusSurface : public testing::Test {
protected:
    BusSurface() {
        world.bus();
        world.addPeople(3);
        world.saveAccountOn(world.store());
        world.publishEverything();
        daemon = world.serving();
        center = makeBusNotifications(loop, world.bus().address());
        begins = center->observe(
            "CXDStartedSyncingNotification", [this](const Notification&) { together = std::max(together, ++running); },
            false);
        ends = center->observe(
            "CXDPassEndedNotification",
            [this](const Notification&) {
                --running;
                ++passes;
            },
            false);
    }
    // A pass of the command's own comes after all that was sent before.
    void settle() {
        const Ran synced = world.rolvane({"sync"});
        ASSERT_EQ(synced.status, 0) << synced;
        ASSERT_TRUE(waitUntil(
            loop, [this] { return passes > 0 && running == 0; }, "the end of the passes"));
    }

    DaemonWorld world;
    std::unique_ptr<ChildProcess> daemon;
    RunLoop loop;
    std::unique_ptr<DistributedNotifications> center;
    ObservationHandle begins, ends;
    int running = 0, together = 0, passes = 0;
};

TEST_F(BusSurface, AFloodOfSignalsMakesOnePassAfterAnotherAndTakesNoMemory) {
    constexpr int kSignals = 20'000, kATurn = 1000;
    const long before = peakMegabytes(daemon->pid());
    const std::string text(5000, 'x');
    for (int i = 0; i < kSignals; ++i)
        ASSERT_TRUE(center->post({i % 2 ? "CXSubscriptionListChanged" : "CXAllACLChanged", {}, {{"text", text}}}));
    settle();
    EXPECT_EQ(together, 1) << "passes run beside each other";
    EXPECT_LT(passes, 4 * kSignals / kATurn);
    EXPECT_LT(peakMegabytes(daemon->pid()) - before, 40);
    EXPECT_TRUE(daemon->running());
}

// The bus puts the real sender's name on every message, and the daemon asks for none: any program of the user may wish
// for a pass. Nothing that a signal holds is believed.
TEST_F(BusSurface, ASignalWithAForgedSenderAndHostileContentsIsAWishForAPassAndNothingElse) {
    const auto tree = world.tree();
    const Bus forger = connectBus(world.bus().address(), std::chrono::milliseconds(5000));
    ASSERT_TRUE(forger);
    for (const char* name : {"CXSubscriptionListChanged", "CXAllACLChanged", "SimulateVaultraNotification",
                             "CXDPassEndedNotification", "CXDStoppedSyncingNotification", "Unheard"}) {
        sd_bus_message* message = nullptr;
        ASSERT_GE(sd_bus_message_new_signal(forger.get(), &message, "/net/rolvane/Notifications",
                                            "net.rolvane.Notifications", name),
                  0);
        sd_bus_message_set_sender(message, "org.freedesktop.DBus");
        ASSERT_GE(sd_bus_message_append(message, "a{sv}", 4, "path", "s", (world.home / "victim").c_str(), "user", "s",
                                        "../../mallory", "remoteLocation", "s", "file:///etc", "number", "x",
                                        static_cast<int64_t>(1) << 62),
                  0);
        ASSERT_GE(sd_bus_send(forger.get(), message, nullptr), 0);
        sd_bus_message_unref(message);
    }
    ASSERT_TRUE(drainBus(forger.get(), std::chrono::milliseconds(5000)));
    const Ran synced = world.rolvane({"sync"});
    EXPECT_EQ(synced.status, 0) << synced;
    EXPECT_TRUE(daemon->running());
    EXPECT_EQ(world.tree(), tree);
    EXPECT_EQ(world.differences(), "");
    EXPECT_EQ(world.pendingChanges(), 0U);
}

} // namespace
} // namespace rolvane::test
