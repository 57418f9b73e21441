#include "conduits/CXDConduit.h"

#include "conduits/PublishedLayout.h"
#include "contacts/records/CXMultiValue.h"
#include "contacts/records/Constants.h"
#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/PropertyList.h"
#include "model/PayloadKeys.h"

namespace rolvane {

CXDConduit::CXDConduit(ConduitEngine& engine) : _engine(engine) {}
CXDConduit::~CXDConduit() = default;

std::optional<std::string> CXDConduit::conduitID() const {
    return std::nullopt;
}

std::optional<UserName> CXDConduit::realUserFromUser(const std::optional<UserName>& user) const {
    return user;
}

int32_t CXDConduit::conduitSource() const {
    return 0;
}

CXFileManager* CXDConduit::defaultManager() const {
    return nullptr;
}

std::optional<Url> CXDConduit::baseLocationForUser(const std::optional<UserName>& /*user*/) const {
    return std::nullopt;
}

bool CXDConduit::applyChangeRecord(const CXDChangeRecordPtr& /*record*/, bool* /*denied*/) {
    return false;
}

void CXDConduit::open() {}

void CXDConduit::close() {
    const auto identifier = conduitID();
    if (!identifier) return;
    Dictionary prior = _engine.conduitObjectForKey(*identifier, kPriorState);
    for (const RemoteLocation& location : _engine.revokedRemoteLocations()) {
        prior.remove(_engine.userForRemoteLocation(location).str());
        // The next subscription to the location starts with the rights that it is given.
        if (_ACLManagerMap) _ACLManagerMap->erase(location.str());
    }
}

CXDChangeRecords CXDConduit::changeRecords() {
    const auto identifier = conduitID();
    const Dictionary prior = identifier ? _engine.conduitObjectForKey(*identifier, kPriorState) : Dictionary();
    return comparePriorStateToCurrentState(prior, currentState());
}

bool CXDConduit::holds(const CXDChangeRecord& /*record*/) {
    return true;
}

bool CXDConduit::applyChangeRecordIfNeeded(const CXDChangeRecordPtr& record, bool* denied) {
    // The record's user itself, not its real user: that is how the location of a revoked subscription is written.
    const auto base = baseLocationForUser(record->user());
    if (base && _engine.isRevoked(RemoteLocation(base->absoluteString()))) return true;
    if (_engine.shouldChangeRecordBeCanceled(*record)) return true;
    try {
        return applyChangeRecord(record, denied);
    } catch (const CXException& exception) {
        CXLog("Exception with applying change record: %@", exception);
        CXLog("Change record: %@", record->description());
        return false;
    }
}

std::string CXDConduit::stringForDictionary(const Dictionary& dictionary) const {
    return PropertyList::toXML(dictionary);
}

bool CXDConduit::saveACLs() {
    if (_ACLManagerMap)
        for (const auto& [location, manager] : *_ACLManagerMap) manager->save();
    return true;
}

std::shared_ptr<CXACLManager> CXDConduit::ACLManagerForRemoteLocation(const Url& location) {
    if (!_ACLManagerMap) _ACLManagerMap.emplace();
    const auto base = baseLocationForRemoteLocation(location);
    if (!base) return nullptr;
    const auto found = _ACLManagerMap->find(base->absoluteString());
    return found == _ACLManagerMap->end() ? nullptr : found->second;
}

std::optional<Url> CXDConduit::baseLocationForRemoteLocation(const Url& location) const {
    const UserName user = _engine.userForRemoteLocation(RemoteLocation(location.absoluteString()));
    return baseLocationForUser(realUserFromUser(user));
}

std::optional<Url> CXDConduit::locationForUID(const UniqueId& uid, const std::optional<UserName>& user) const {
    const auto base = baseLocationForUser(realUserFromUser(user));
    if (!base) return std::nullopt;
    return layout::contactLocation(*base, uid);
}

bool CXDConduit::isASpecialFile(const std::string& name) const {
    return layout::isASpecialFile(name);
}

void CXDConduit::stampWithRemoteLocation(Dictionary& dictionary, const RemoteLocation& location) const {
    Dictionary stamp;
    stamp.set("labels", Array{kCXSubscribeLabel});
    stamp.set("values", Array{location});
    stamp.set("identifiers", Array{CXMultiValue::_generateIdentifier()});
    dictionary.set(kCXRemoteLocationProperty, stamp);
}

void CXDConduit::unstamp(Dictionary& dictionary) const {
    dictionary.remove(kCXRemoteLocationProperty);
}

} // namespace rolvane
