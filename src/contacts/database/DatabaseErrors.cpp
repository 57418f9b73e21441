#include "contacts/database/DatabaseErrors.h"

#include "contacts/database/DamagedDatabase.h"

namespace rolvane {

void throwDatabaseError(const std::string& path, const SqliteFailure& failure) {
    std::string told = "Could not " + failure.doing + " the contact database " + path + ": " + cxExplanation(failure);
    if (!failure.isDamage()) throw CXException(kCXDatabaseException, std::move(told));
    throw CXDamagedDatabase(told + " `rolvane restore FILE` puts a backup in its place.");
}

} // namespace rolvane
