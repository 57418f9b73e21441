#include "acl/CXDCXACLManager.h"

#include "contacts/database/CXRolvane.h"
#include "contacts/records/Constants.h"

#include <algorithm>
#include <cstdint>

namespace rolvane {
namespace {

bool holdsSelf(const std::vector<UserName>& list) {
    return std::find(list.begin(), list.end(), kSelf) != list.end();
}

// The count of entries as a truth value of one byte: 256 entries are as good as none.
bool hasEntries(const std::optional<CXMultiValue>& list) {
    return list && static_cast<uint8_t>(list->count()) != 0;
}

void put(CXAllGroup& group, const char* property, const CXMultiValue& principals, bool granted) {
    const auto present = group.multiValueForProperty(property);
    if (!granted) {
        if (!group.valueForProperty(property).isAbsent()) group.removeValueForProperty(property);
    } else if (!present || !present->sameContents(principals)) {
        // The same list with fresh identifiers would be an edit, saved and announced for nothing.
        group.setValue(principals, property);
    }
}

} // namespace

CXDCXACLManager::CXDCXACLManager(Url baseLocation, const LocationOwner& owner, CXRolvane& database, UserName realUser)
    : CXACLManager(std::move(baseLocation), owner), _database(database), _realUser(std::move(realUser)) {
    CXDCXACLManager::load();
}

CXAllGroupRef CXDCXACLManager::allGroup() const {
    return _database.allGroupForRemoteLocation(RemoteLocation(_baseLocation.absoluteString()));
}

bool CXDCXACLManager::load() {
    const CXAllGroupRef group = allGroup();
    grantPrincipal(kSelf, false);
    if (group && hasEntries(group->multiValueForProperty(kCXReadWriteSharingACLProperty))) grantPrincipal(kSelf, true);
    return true;
}

bool CXDCXACLManager::save() {
    if (_publisher) return true;
    const CXAllGroupRef group = allGroup();
    if (!group) return true;
    CXMutableMultiValue principals;
    principals.addValue(_realUser.str(), _realUser.str());
    put(*group, kCXReadSharingACLProperty, principals, holdsSelf(_readAccessPrincipals));
    put(*group, kCXReadWriteSharingACLProperty, principals, holdsSelf(_allAccessPrincipals));
    return true;
}

} // namespace rolvane
