#include "support/UnitExposure.h"

#include "support/ChildProcess.h"

#include <fstream>
#include <set>

namespace rolvane::test {

testing::AssertionResult isConfined(const std::string& file) {
    // Looked at in a user manager of systemd 252: tests/units/run. /proc is mounted anew for nobody without rights over
    // its process namespace; filters of addresses and devices are programs that only root loads.
    static const std::set<std::string> kNotForUsers{
        "ProtectProc", "ProcSubset", "IPAddressDeny",       "IPAddressAllow", "DeviceAllow",         "DevicePolicy",
        "User",        "Group",      "DynamicUser",         "RootDirectory",  "RootImage",           "KeyringMode",
        "PrivateIPC",  "RemoveIPC",  "SupplementaryGroups", "Delegate",       "AmbientCapabilities", "NotifyAccess"};
    std::ifstream lines(file);
    if (!lines) return testing::AssertionFailure() << file << " cannot be read";
    bool hasUsers = false;
    for (std::string line; std::getline(lines, line);) {
        hasUsers = hasUsers || line == "PrivateUsers=yes";
        if (kNotForUsers.contains(line.substr(0, line.find('='))))
            return testing::AssertionFailure() << file << ": no user manager applies " << line;
    }
    if (!hasUsers) return testing::AssertionFailure() << file << ": without PrivateUsers=yes the rest is left out";
    ChildProcess analysis({"systemd-analyze", "--offline=yes", "--threshold=25", "security", file});
    const auto ending = analysis.wait(60);
    if (ending && ending->exitedWith(0)) return testing::AssertionSuccess();
    return testing::AssertionFailure() << file << ":\n" << analysis.output() << analysis.errors();
}

} // namespace rolvane::test
