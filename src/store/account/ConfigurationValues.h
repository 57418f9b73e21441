#pragma once

#include "foundation/Value.h"

#include <mutex>
#include <string>

namespace rolvane {

// Configuration values: the daemon's preferences domain, then the application's, then configDirectory()/config.plist
// (a dictionary). A file that cannot be read counts as empty and is logged. Any thread.
class ConfigurationValues {
public:
    static ConfigurationValues& shared();
    Value valueForKey(const std::string& key, Value defaultValue);
    void updateIfNeeded(); // reads the file anew when its path, time or size has changed

private:
    std::mutex _mutex; // guards the following
    std::string _stamp;
    Dictionary _file;
};

} // namespace rolvane
