#include "contacts/database/CXUserDefaults.h"

#include <atomic>

namespace rolvane {

namespace {
std::atomic<Preferences*> inUse{nullptr};
}

Preferences& CXUserDefaults::preferences() {
    Preferences* given = inUse.load();
    return given ? *given : Preferences::shared();
}

RolvaneManagerPreferences CXUserDefaults::rolvaneManagerPreferences() {
    return RolvaneManagerPreferences(preferences());
}

void CXUserDefaults::usePreferences(Preferences* preferences) {
    inUse.store(preferences);
}

} // namespace rolvane
