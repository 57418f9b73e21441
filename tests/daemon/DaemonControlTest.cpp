#include "daemon/DaemonControl.h"

#include "DaemonWorld.h"

#include <latch>
#include <thread>

namespace rolvane::test {
namespace {

DaemonControl controlOf(const std::string& program) {
    DaemonControl::Options options;
    options.program = program;
    options.useServiceManager = false;
    return DaemonControl(options);
}

TEST(DaemonControlOf, StartsOneAndStopsIt) {
    DaemonWorld world;
    const DaemonControl control = controlOf(UserWorld::managerProgram());
    EXPECT_FALSE(control.running());
    EXPECT_TRUE(control.start());
    EXPECT_TRUE(control.running());
    EXPECT_FALSE(control.start());
    EXPECT_TRUE(control.stop());
    EXPECT_FALSE(control.running());
    EXPECT_FALSE(control.stop());
}

TEST(DaemonControlOf, TwoWhoStartItAtOnceBothHaveIt) {
    DaemonWorld world;
    const DaemonControl control = controlOf(UserWorld::managerProgram());
    for (int attempt = 0; attempt < 4; ++attempt) {
        constexpr int kStarters = 4;
        std::latch together(kStarters);
        std::atomic<int> started{0};
        std::vector<std::string> failures(kStarters);
        {
            std::vector<std::jthread> starters;
            for (int i = 0; i < kStarters; ++i)
                starters.emplace_back([&, i] {
                    together.arrive_and_wait();
                    try {
                        started += control.start();
                    } catch (const CXException& e) {
                        failures[static_cast<size_t>(i)] = e.reason();
                    }
                });
        }
        for (const std::string& failure : failures) EXPECT_EQ(failure, "");
        EXPECT_EQ(started, 1);
        EXPECT_TRUE(control.running());
        EXPECT_TRUE(control.stop());
    }
}

} // namespace
} // namespace rolvane::test
