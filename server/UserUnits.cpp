#include "server/UserUnits.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"
#include "foundation/QuietProgram.h"
#include "server/PrivateStore.h"

#include <filesystem>
#include <unistd.h>

namespace rolvane {

namespace {

int manager(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), {"systemctl", "--user"});
    return runQuietly(std::move(arguments));
}

void require(int status, const std::string& what, const std::string& unit) {
    if (status != 0)
        throw CXException(kCXPrivateStoreException, "The service manager could not " + what + " " + unit +
                                                        ". `systemctl --user status " + unit + "` says why.");
}

} // namespace

bool UserUnits::available() {
    return geteuid() != 0 && manager({"show-environment"}) == 0;
}

std::string UserUnits::directory() {
    return std::filesystem::path(configDirectory()).parent_path().string() + "/systemd/user";
}

bool UserUnits::has(const std::string& unit) {
    return access((directory() + "/" + unit).c_str(), F_OK) == 0;
}

void UserUnits::install(const std::map<std::string, std::string>& units) {
    CXPathUtils_MakeCompletePath(directory(), 0700);
    for (const auto& [name, text] : units) writeFileDurably(directory() + "/" + name, text, 0644);
    require(manager({"daemon-reload"}), "read", units.empty() ? "its units" : units.begin()->first);
}

void UserUnits::enable(const std::string& unit) {
    require(manager({"enable", "--now", unit}), "start", unit);
}

void UserUnits::start(const std::string& unit) {
    require(manager({"start", unit}), "start", unit);
}

void UserUnits::remove(const std::vector<std::string>& units) {
    bool any = false;
    for (const std::string& unit : units) {
        if (!has(unit)) continue;
        any = true;
        manager({"disable", "--now", unit});
        manager({"stop", unit});
        std::error_code ignored;
        std::filesystem::remove(directory() + "/" + unit, ignored);
    }
    if (any) manager({"daemon-reload"});
}

bool UserUnits::isActive(const std::string& unit) {
    return manager({"is-active", "--quiet", unit}) == 0;
}

} // namespace rolvane
