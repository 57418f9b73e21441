#include "store/account/ConfigurationValues.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "foundation/Paths.h"
#include "foundation/Preferences.h"
#include "foundation/PropertyList.h"

#include <sys/stat.h>

namespace rolvane {

ConfigurationValues& ConfigurationValues::shared() {
    static ConfigurationValues configuration;
    return configuration;
}

void ConfigurationValues::updateIfNeeded() {
    Lock guard(_mutex);
    try {
        const std::string path = configDirectory() + "/config.plist";
        struct stat st {};
        const bool present = stat(path.c_str(), &st) == 0;
        const std::string stamp =
            path + (present ? "|" + std::to_string(st.st_mtim.tv_sec) + "." + std::to_string(st.st_mtim.tv_nsec) + "|" +
                                  std::to_string(st.st_size) + "|" + std::to_string(st.st_ino)
                            : "");
        if (stamp == _stamp) return;
        _stamp = stamp;
        _file = Dictionary();
        if (present) _file = PropertyList::fromFile(path, {1u << 20, 16}).dictionary();
    } catch (const CXException& e) {
        CXLog("The configuration is not used: %@", e.reason());
    }
}

Value ConfigurationValues::valueForKey(const std::string& key, Value defaultValue) {
    for (const char* domain : {kDaemonDomain, kApplicationDomain}) {
        try {
            if (Value v = Preferences::shared().get(domain, key)) return v;
        } catch (const CXException& e) {
            CXDLog("No configuration value from %@: %@", domain, e.reason());
        }
    }
    updateIfNeeded();
    Lock guard(_mutex);
    const Value& v = _file[key];
    return v ? v : defaultValue;
}

} // namespace rolvane
