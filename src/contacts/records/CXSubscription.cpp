#include "contacts/records/CXSubscription.h"

#include "contacts/database/RolvaneImpl.h"

namespace rolvane {

CXSubscriptionRef CXSubscription::create(const RemoteLocation& location, bool isAll, std::string_view name) {
    Dictionary properties{{kCXRemoteLocationProperty, location.str()}, {kCXSubscriptionIsAllProperty, isAll}};
    if (!name.empty()) properties.set(kCXSubscriptionNameProperty, name);
    return CXSubscriptionRef(new CXSubscription(makeUniqueId(kCXSubscriptionTable), properties));
}

CXSubscriptionRef CXSubscription::findSubscriptionWithRemoteLocation(const RemoteLocation& location) {
    return CXRolvane::sharedRolvane().findSubscriptionWithRemoteLocation(location);
}

RemoteLocation CXSubscription::remoteLocation() const {
    return RemoteLocation(valueForProperty(kCXRemoteLocationProperty).string());
}

bool CXSubscription::_isAll() const {
    return valueForProperty(kCXSubscriptionIsAllProperty).boolean();
}
std::string CXSubscription::name() const {
    return valueForProperty(kCXSubscriptionNameProperty).string();
}
bool CXSubscription::isLocal() const {
    return remoteLocation().str() == kCXLocalRemoteLocation;
}

} // namespace rolvane
