#include "daemon/BusPresence.h"

#include "DaemonWorld.h"

#include "daemon/LogControl.h"
#include "foundation/BusConnection.h"
#include "foundation/Paths.h"
#include "support/WaitUntil.h"

#include <filesystem>
#include <fstream>

namespace rolvane::test {
namespace {

using namespace std::chrono_literals;

// A program of the user's on the bus.
struct Neighbour {
    explicit Neighbour(const std::string& address) : bus(connectBus(address, 10s)) { EXPECT_TRUE(bus); }
    bool sees(const char* name) {
        sd_bus_message* reply = nullptr;
        int owned = 0;
        if (sd_bus_call_method(bus.get(), "org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus",
                               "NameHasOwner", nullptr, &reply, "s", name) >= 0)
            sd_bus_message_read(reply, "b", &owned);
        sd_bus_message_unref(reply);
        return owned != 0;
    }
    std::string property(const char* name) {
        char* text = nullptr;
        const int result = sd_bus_get_property_string(bus.get(), BusPresence::kName, BusPresence::kLogPath,
                                                      "org.freedesktop.LogControl1", name, nullptr, &text);
        const std::string value = text ? text : "no answer: " + std::to_string(result);
        std::free(text);
        return value;
    }
    // The name of the error; empty: it was taken.
    std::string set(const char* name, const char* value) {
        sd_bus_error error = SD_BUS_ERROR_NULL;
        sd_bus_set_property(bus.get(), BusPresence::kName, BusPresence::kLogPath, "org.freedesktop.LogControl1", name,
                            &error, "s", value);
        const std::string told = error.name ? error.name : "";
        sd_bus_error_free(&error);
        return told;
    }
    Bus bus;
};

TEST(BusPresence, ShowsTheLogOfTheDaemonAndChangesItWhileItRuns) {
    DaemonWorld world;
    Neighbour neighbour(world.bus().address());
    const auto daemon = world.serving();
    ASSERT_TRUE(waitUntil([&] { return neighbour.sees(BusPresence::kName); }, "the daemon's name"));
    EXPECT_EQ(neighbour.property("SyslogIdentifier"), "RolvaneManager");
    EXPECT_EQ(neighbour.property("LogLevel"), "debug") << "it was started with a debug level of 1";
    EXPECT_EQ(neighbour.set("LogLevel", "notice"), "");
    EXPECT_EQ(neighbour.property("LogLevel"), "notice");
    EXPECT_EQ(neighbour.set("LogLevel", "loud"), SD_BUS_ERROR_INVALID_ARGS);
    EXPECT_EQ(neighbour.property("LogLevel"), "notice");
    EXPECT_EQ(neighbour.set("LogTarget", "console"), "");
    EXPECT_EQ(neighbour.property("LogTarget"), "console");
    EXPECT_EQ(neighbour.set("LogTarget", "printer"), SD_BUS_ERROR_INVALID_ARGS);
    daemon->signal(SIGTERM);
    daemon->wait();
    EXPECT_FALSE(neighbour.sees(BusPresence::kName));
}

// The main thread waits for a store that says nothing.
TEST(BusPresence, AnswersInTheMiddleOfAPass) {
    DaemonWorld world;
    Neighbour neighbour(world.bus().address());
    const SilentServer silent;
    world.saveAccountOnPlain(silent.port());
    world.addPeople(1);
    world.publishEverything();
    world.setDebugLevel(1);
    world.closeDatabase();
    const auto daemon = world.startManager();
    ASSERT_TRUE(silent.somebodyWaits(60));
    ASSERT_TRUE(waitUntil([&] { return neighbour.sees(BusPresence::kName); }, "the daemon's name"));
    EXPECT_EQ(neighbour.set("LogLevel", "warning"), "");
    EXPECT_EQ(neighbour.property("LogLevel"), "notice");
    EXPECT_EQ(daemon->errors().find("Entering main run loop."), std::string::npos) << "the pass has ended";
}

TEST(BusPresence, ComesBackWithTheBus) {
    DaemonWorld world;
    world.bus();
    const auto daemon = world.serving();
    world.bus().restart();
    Neighbour neighbour(world.bus().address());
    EXPECT_TRUE(waitUntil([&] { return neighbour.sees(BusPresence::kName); }, "the daemon's name"));
}

TEST(BusPresence, StartsTheDaemonForWhoeverAsksForItsName) {
    DaemonWorld world;
    std::string file = readFile(ROLVANE_SOURCE_DIR "/packaging/dbus/net.rolvane.RolvaneManager.service.in");
    const size_t place = file.find("@BINDIR@");
    ASSERT_NE(place, std::string::npos);
    file.replace(place, 8, std::filesystem::path(DaemonWorld::managerProgram()).parent_path().string());
    // A bus that starts programs, with the environment of this home.
    const std::string services = world.home / "services", address = "unix:path=" + (world.home / "bus");
    std::filesystem::create_directory(services);
    std::ofstream(services + "/" + BusPresence::kName + ".service") << file;
    std::ofstream(world.home / "bus.conf")
        << "<busconfig><type>session</type><listen>" + address + "</listen><servicedir>" + services +
               "</servicedir><policy context=\"default\"><allow send_destination=\"*\" "
               "eavesdrop=\"true\"/><allow eavesdrop=\"true\"/><allow own=\"*\"/>"
               "</policy></busconfig>\n";
    ChildProcess bus({"dbus-daemon", "--config-file=" + (world.home / "bus.conf"), "--nofork", "--print-address=1"});
    ASSERT_TRUE(bus.waitForLine("^unix:"));
    world.home.setVariable("DBUS_SESSION_BUS_ADDRESS", address);
    Neighbour neighbour(address);
    EXPECT_FALSE(world.daemon());
    EXPECT_EQ(neighbour.property("SyslogIdentifier"), "RolvaneManager");
    EXPECT_TRUE(world.daemon());
}

TEST(BusPresence, KnowsTheLevelsOfTheSystemsLog) {
    for (const char* quiet : {"emerg", "alert", "crit", "err", "warning", "notice"})
        EXPECT_EQ(debugLevelOfName(quiet, 3), 0) << quiet;
    for (const char* loud : {"info", "debug"}) {
        EXPECT_EQ(debugLevelOfName(loud, 0), 1) << loud;
        EXPECT_EQ(debugLevelOfName(loud, 3), 3) << loud;
    }
    EXPECT_EQ(debugLevelOfName("", 0), -1);
    EXPECT_EQ(debugLevelOfName("Debug", 0), -1);
}

} // namespace
} // namespace rolvane::test
