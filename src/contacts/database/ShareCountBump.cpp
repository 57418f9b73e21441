#include "contacts/database/ShareCountBump.h"

#include "contacts/database/RolvaneImpl.h"
#include "foundation/Preferences.h"

namespace rolvane {

namespace {

constexpr const char* kShareCountKey = "CXDShareCount";
constexpr const char* kIntentKey = "CXDShareCountIntent";

} // namespace

int64_t ShareCountBump::writeIntent() {
    _database.save(); // the token must be of a history that the new count continues
    int64_t count = _database.shareCount() + 1;
    _preferences.set(kDaemonDomain, kShareCountKey, count);
    _preferences.set(kDaemonDomain, kIntentKey,
                     Dictionary{{"count", count},
                                {"identity", _database.databaseIdentity()},
                                {"token", _database.impl().journal.latestToken()}});
    _preferences.synchronize(kDaemonDomain);
    return count;
}

void ShareCountBump::writeDatabase(int64_t count) {
    _database.setShareCount(count);
    _database.save();
}

void ShareCountBump::clearIntent() {
    _preferences.remove(kDaemonDomain, kIntentKey);
    _preferences.synchronize(kDaemonDomain);
}

void ShareCountBump::recover() {
    Value intent = _preferences.get(kDaemonDomain, kIntentKey);
    if (intent.isAbsent()) return;
    Dictionary meant = intent.dictionary();
    int64_t count = meant["count"].integer();
    const std::string& token = meant["token"].string();
    bool sameDatabase = meant["identity"].string() == _database.databaseIdentity();
    // A copy of an earlier state lacks the save that the intent names.
    bool sameHistory = token.empty() || _database.impl().journal.hasToken(token);
    if (sameDatabase && sameHistory && _database.shareCount() == count - 1) writeDatabase(count);
    clearIntent();
}

} // namespace rolvane
