#include "engine/recovery/DatabaseCare.h"

#include "contacts/database/CXRolvane.h"
#include "contacts/database/DamagedDatabase.h"
#include "engine/EngineParts.h"
#include "foundation/Log.h"

namespace rolvane {

namespace {

void note(EngineParts& parts, const Value& damage) {
    Preferences& preferences = parts.with.preferences;
    if (preferences.get(kDaemonDomain, kCXDDamagedDatabase) == damage) return;
    try {
        damage ? preferences.set(kDaemonDomain, kCXDDamagedDatabase, damage)
               : preferences.remove(kDaemonDomain, kCXDDamagedDatabase);
        preferences.synchronize(kDaemonDomain);
    } catch (const CXException& e) {
        CXLog("The damage of the contact database could not be noted: %@", e);
    }
}

void tell(EngineParts& parts, const std::string& damage) {
    CXLog("The contact database is damaged: %@", damage);
    parts.outcomes.caught(damage);
    note(parts, damage);
}

} // namespace

bool mendDatabase(EngineParts& parts) {
    const bool isNoted = parts.with.preferences.get(kDaemonDomain, kCXDDamagedDatabase).isString();
    if (!isNoted && damageOf(parts.with.rolvane).empty()) return true;
    try {
        repairDatabase(parts.with.rolvane);
    } catch (const CXException& e) {
        tell(parts, e.reason());
        return false;
    }
    note(parts, {});
    CXLog("The contact database %@ was damaged. Its indexes have been rebuilt, and the whole file is in order again.",
          parts.with.rolvane.path());
    return true;
}

bool meetsDamage(EngineParts& parts) {
    const std::string damage = damageOf(parts.with.rolvane);
    if (damage.empty()) return false;
    tell(parts, damage);
    return true;
}

} // namespace rolvane
