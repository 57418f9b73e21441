#include "model/Computers.h"

#include "foundation/Paths.h"
#include "foundation/Preferences.h"

#include <array>
#include <fstream>
#include <unistd.h>

namespace rolvane {
namespace {

constexpr const char *kId = "id", *kMachine = "machine";

// "" where the system has none.
std::string machine() {
    std::ifstream file("/etc/machine-id");
    std::string text;
    std::getline(file, text);
    return text;
}

std::string hostName() {
    std::array<char, 256> name{};
    return gethostname(name.data(), name.size() - 1) == 0 && name[0] != '\0' ? name.data() : "a computer";
}

} // namespace

bool isOneOfSeveral(const Preferences& preferences) {
    return preferences.get(kDaemonDomain, kCXDOneOfSeveral).boolean();
}

void becomeOneOfSeveral(Preferences& preferences) {
    preferences.set(kDaemonDomain, kCXDOneOfSeveral, true);
    preferences.synchronize(kDaemonDomain);
}

void becomeTheOnlyOne(Preferences& preferences) {
    for (const char* key : {kCXDOneOfSeveral, kCXDComputers, kCXDToldOfItself}) preferences.remove(kDaemonDomain, key);
    preferences.synchronize(kDaemonDomain);
}

Computer thisComputer(Preferences& preferences) {
    Dictionary known = preferences.get(kDaemonDomain, kCXDComputer).dictionary();
    const std::string before = known[kMachine].string(), now = machine();
    // A program that may not read the machine's identifier is still on the same machine.
    if (known[kId].string().empty() || (!now.empty() && !before.empty() && before != now)) {
        known = Dictionary{{kId, makeUUID()}, {kMachine, now}};
        preferences.set(kDaemonDomain, kCXDComputer, known);
        preferences.synchronize(kDaemonDomain);
    }
    const std::string chosen = preferences.get(kDaemonDomain, kCXDComputerName).string();
    return {known[kId].string(), chosen.empty() ? hostName() : chosen, std::nullopt};
}

} // namespace rolvane
