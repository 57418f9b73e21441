#pragma once

#include "foundation/Mutex.h"
#include "foundation/Value.h"

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
    Mutex _mutex;
    std::string _stamp GUARDED_BY(_mutex);
    Dictionary _file GUARDED_BY(_mutex);
};

} // namespace rolvane
