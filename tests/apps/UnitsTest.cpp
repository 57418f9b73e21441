// The user units that are installed. tests/units/run tries them in a real user manager.

#include "support/ChildProcess.h"
#include "support/TempHome.h"
#include "support/UnitExposure.h"

#include "foundation/Paths.h"

#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>

namespace rolvane::test {
namespace {

namespace fs = std::filesystem;

// As they are installed below /usr.
std::vector<std::string> installedUnits(const TempDirectory& directory) {
    std::vector<std::string> files;
    for (const auto& each : fs::directory_iterator(ROLVANE_SOURCE_DIR "/packaging/systemd")) {
        std::string text = readFile(each.path());
        for (size_t at; (at = text.find("@BINDIR@")) != std::string::npos;) text.replace(at, 8, "/usr/bin");
        const std::string name = each.path().extension() == ".in" ? each.path().stem() : each.path().filename();
        std::ofstream(directory / name) << text;
        files.push_back(directory / name);
    }
    return files;
}

TEST(Units, AreConfinedAsFarAsAUserManagerCan) {
    const TempDirectory directory;
    size_t services = 0;
    for (const std::string& file : installedUnits(directory))
        if (file.ends_with(".service")) {
            EXPECT_TRUE(isConfined(file));
            ++services;
        }
    EXPECT_EQ(services, 2U);
}

TEST(Units, AreNotConfinedByTheSettingsOfLongAgo) {
    const TempDirectory directory;
    std::ofstream(directory / "former.service")
        << "[Service]\nExecStart=/usr/bin/true\nNoNewPrivileges=yes\nPrivateTmp=yes\nPrivateUsers=yes\n";
    EXPECT_FALSE(isConfined(directory / "former.service")) << "the check does not see an open unit";
    std::ofstream(directory / "dressed.service") << "[Service]\nExecStart=/usr/bin/true\nProtectProc=invisible\n";
    EXPECT_FALSE(isConfined(directory / "dressed.service"));
}

// The units of the system's manager, by the names that the package installs them with.
std::vector<std::string> storeUnits(const TempDirectory& directory) {
    std::vector<std::string> files;
    for (const auto& each : fs::directory_iterator(ROLVANE_SOURCE_DIR "/packaging/debian")) {
        std::string name = each.path().filename();
        if (!name.ends_with(".service") && !name.ends_with(".timer")) continue;
        if (name.starts_with("rolvane-store.rolvane-")) name.erase(0, std::string("rolvane-store.").size());
        std::string text = readFile(each.path());
        for (size_t at; (at = text.find("/usr/bin/rolvane")) != std::string::npos;)
            text.replace(at, std::string("/usr/bin/rolvane").size(), "/usr/bin/true"); // it is not installed here
        std::ofstream(directory / name) << text;
        files.push_back(directory / name);
    }
    return files;
}

int exposedTo(const std::string& unit) { // systemd-analyze's own threshold, in tenths
    ChildProcess look({"systemd-analyze", "--offline=yes", "--no-pager", "--threshold=25", "security", unit});
    const auto ending = look.wait(60);
    return ending ? ending->status : -1;
}

TEST(StoreUnits, HaveAnExposureOfTwoAndAHalfAtMost) {
    const TempDirectory directory;
    size_t services = 0;
    for (const std::string& file : storeUnits(directory))
        if (file.ends_with(".service")) {
            EXPECT_EQ(exposedTo(file), 0) << file;
            ++services;
        }
    EXPECT_EQ(services, 2U);
    std::ofstream(directory / "open.service") << "[Service]\nUser=nobody\nExecStart=/usr/bin/true\n";
    EXPECT_EQ(exposedTo(directory / "open.service"), 1) << "the check does not see an open unit";
}

TEST(StoreUnits, AreWhatSystemdTakes) {
    const TempDirectory directory;
    std::vector<std::string> command{"systemd-analyze", "--man=no", "verify"};
    for (const std::string& file : storeUnits(directory)) command.push_back(file);
    ASSERT_EQ(command.size(), 6U) << "two services and a timer";
    ChildProcess verify(command);
    const auto ending = verify.wait(60);
    ASSERT_TRUE(ending);
    EXPECT_EQ(ending->status, 0) << verify.errors();
    EXPECT_EQ(verify.errors(), "");
}

TEST(Units, AreWhatSystemdTakes) {
    const TempDirectory directory;
    std::vector<std::string> command{
        "env", "XDG_RUNTIME_DIR=" + directory.path(), "systemd-analyze", "--user", "--man=no", "verify"};
    for (const std::string& file : installedUnits(directory)) command.push_back(file);
    // The program is not installed here; everything else that systemd says would be a finding.
    ChildProcess verify(command);
    const auto ending = verify.wait(60);
    ASSERT_TRUE(ending);
    std::istringstream lines(verify.errors());
    for (std::string line; std::getline(lines, line);)
        EXPECT_THAT(line, testing::AnyOf(testing::HasSubstr("/usr/bin/RolvaneManager is not executable"),
                                         testing::Not(testing::HasSubstr(directory.path()))))
            << line;
}

} // namespace
} // namespace rolvane::test
