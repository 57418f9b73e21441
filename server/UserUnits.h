#pragma once

#include <map>
#include <string>
#include <vector>

namespace rolvane {

// Units that a program of this user makes for the user's systemd, in $XDG_CONFIG_HOME/systemd/user. Any thread.
class UserUnits {
public:
    // There is a service manager of this user that answers. Root's services are not started this way.
    static bool available();
    static std::string directory();
    static bool has(const std::string& unit); // such a file lies there

    // Each throws kCXPrivateStoreException with the command that shows more.
    static void install(const std::map<std::string, std::string>& units); // texts by name; written and read in
    static void enable(const std::string& unit);                          // now and at every login
    static void start(const std::string& unit);
    // Stops, disables and deletes them; what is not there is passed over, and nothing is thrown.
    static void remove(const std::vector<std::string>& units);
    static bool isActive(const std::string& unit);
};

} // namespace rolvane
