#pragma once

#include "foundation/Preferences.h"

#include <string_view>

namespace rolvane {

// The daemon's own preferences domain, read as the conduits and the engine read it: afresh at every call.
class RolvaneManagerPreferences {
public:
    explicit RolvaneManagerPreferences(Preferences& preferences) : _preferences(preferences) {}
    Value objectForKey(std::string_view key) const { return _preferences.get(kDaemonDomain, key); } // absent if none

private:
    Preferences& _preferences;
};

class CXUserDefaults {
public:
    // Over Preferences::shared(), or over what usePreferences gave.
    static RolvaneManagerPreferences rolvaneManagerPreferences();
    static Preferences& preferences();
    // For tests and programs with preferences of their own; null goes back to the shared ones. Not owned.
    static void usePreferences(Preferences* preferences);
};

} // namespace rolvane
