#include "contacts/records/CXRecord.h"

#include "contacts/database/RolvaneImpl.h"
#include "foundation/PropertyList.h"

namespace rolvane {

namespace {

// The table whose rules a record follows, whatever its identifier looks like.
std::string_view tableOf(const CXRecord& record) {
    return tableOfKind(kindOfRecord(record));
}

} // namespace

CXRecord::CXRecord(UniqueId uid, Dictionary properties)
    : _uid(std::move(uid)), _detached(std::move(properties)), _isDetached(true) {}

CXRecord::CXRecord(UniqueId uid, std::weak_ptr<CXRolvane* const> owner)
    : _uid(std::move(uid)), _owner(std::move(owner)), _isDetached(false) {}

CXRecord::~CXRecord() = default;

CXRolvane* CXRecord::owner() const {
    auto anchor = _owner.lock();
    return anchor ? *anchor : nullptr;
}

CXRolvane* CXRecord::rolvane() const {
    return owner();
}

UniqueId CXRecord::sharingUniqueId() const {
    return cxNormalizedUID(_uid);
}

Value CXRecord::valueForProperty(std::string_view property) const {
    if (_isDetached) {
        if (property == kCXUIDProperty) return _uid;
        return _detached[property].deepMutableCopy();
    }
    CXRolvane* database = owner();
    if (!database) return {};
    std::lock_guard lock(database->impl().mutex);
    return database->impl().property(_uid, property);
}

std::optional<CXMultiValue> CXRecord::multiValueForProperty(std::string_view property) const {
    return CXMultiValue::fromValue(valueForProperty(property));
}

bool CXRecord::setValue(Value value, std::string_view property) {
    if (_isDetached) {
        if (!mayHave(kindOfRecord(*this), property, value)) return false;
        if (value.isAbsent())
            _detached.remove(property);
        else
            _detached.set(property, cxCarriableValue(value));
        return true;
    }
    CXRolvane* database = owner();
    if (!database) return false;
    std::lock_guard lock(database->impl().mutex);
    return database->impl().setProperty(_uid, property, cxCarriableValue(value));
}

bool CXRecord::setValue(const CXMultiValue& value, std::string_view property) {
    return setValue(value.toValue(), property);
}

bool CXRecord::removeValueForProperty(std::string_view property) {
    return setValue(Value(), property);
}

Dictionary CXRecord::dictionaryRepresentation() const {
    if (_isDetached) return Value(_detached).deepMutableCopy().dictionary();
    CXRolvane* database = owner();
    if (!database) return {};
    std::lock_guard lock(database->impl().mutex);
    return Value(database->impl().properties(_uid)).deepMutableCopy().dictionary();
}

std::shared_ptr<const Bytes> CXRecord::encodedRepresentation() const {
    CXRolvane* database = owner();
    if (!database) return std::make_shared<const Bytes>(BinaryValue::encode(dictionaryRepresentation()));
    std::lock_guard lock(database->impl().mutex);
    return database->impl().encoded(_uid);
}

void CXRecord::resetWithDictionary(const Dictionary& dictionary, bool skipUnknownProperties,
                                   bool generateMultiValueIDs) {
    Dictionary fresh = cxSanitizedProperties(tableOf(*this), dictionary, skipUnknownProperties, generateMultiValueIDs);
    if (_isDetached) {
        RecordKind kind = kindOfRecord(*this);
        if (isGroup(kind) && !mayHave(kind, kCXGroupNameProperty, fresh[kCXGroupNameProperty]))
            fresh.set(kCXGroupNameProperty, _detached[kCXGroupNameProperty]);
        if (kind == RecordKind::subscription)
            fresh.set(kCXRemoteLocationProperty, _detached[kCXRemoteLocationProperty]);
        _detached = fresh;
        return;
    }
    CXRolvane* database = owner();
    if (!database) return;
    std::lock_guard lock(database->impl().mutex);
    database->impl().replaceProperties(_uid, fresh);
}

std::vector<std::string> CXRecord::cxUsedProperties() const {
    if (_isDetached) return _detached.allKeys();
    CXRolvane* database = owner();
    if (!database) return {};
    std::lock_guard lock(database->impl().mutex);
    return database->impl().properties(_uid).allKeys();
}

RemoteLocation CXRecord::remoteLocation() const {
    if (_isDetached) return RemoteLocation(locationOf(kindOfRecord(*this), _detached));
    CXRolvane* database = owner();
    if (!database) return {};
    std::lock_guard lock(database->impl().mutex);
    return RemoteLocation(database->impl().location(_uid));
}

namespace {

// The location whose publisher decides; empty where the owner does.
RemoteLocation publishedAt(const CXRecord& record) {
    const auto* subscription = dynamic_cast<const CXSubscription*>(&record);
    if (!subscription) return record.isSubscribed() ? record.remoteLocation() : RemoteLocation();
    return subscription->isLocal() ? RemoteLocation() : subscription->remoteLocation();
}

std::string shownName(const CXRecord& record) {
    if (const auto* person = dynamic_cast<const CXPerson*>(&record)) return person->displayName();
    if (const auto* group = dynamic_cast<const CXGroup*>(&record)) return group->name();
    const auto* subscription = dynamic_cast<const CXSubscription*>(&record);
    return subscription ? subscription->name() : std::string();
}

} // namespace

bool CXRecord::isWritable() const {
    const RemoteLocation location = publishedAt(*this);
    if (location.empty()) return !isSubscribed();
    CXRolvane* database = owner();
    if (!database) return false;
    const CXAllGroupRef all = database->allGroupForRemoteLocation(location);
    const auto writers = all ? all->multiValueForProperty(kCXReadWriteSharingACLProperty) : std::nullopt;
    return writers && !writers->empty();
}

std::string CXRecord::readOnlyReason() const {
    if (isWritable()) return {};
    const std::string name = shownName(*this);
    const RemoteLocation location = publishedAt(*this);
    const std::string what = name.empty() ? "This" : "\"" + name + "\"";
    if (location.empty()) return what + " is a copy of somebody else's data and belongs to no subscription any more.";
    return what + " came by the subscription to " + location.str() +
           ", which may be read but not changed. Ask its publisher for the right to write, or make a copy of your own.";
}

bool CXRecord::isAttached() const {
    CXRolvane* database = owner();
    if (!database) return false;
    std::lock_guard lock(database->impl().mutex);
    return database->impl().kind(_uid) != RecordKind::none;
}

bool CXRecord::hasUnsavedChanges() const {
    CXRolvane* database = owner();
    if (!database) return false;
    std::lock_guard lock(database->impl().mutex);
    return database->impl().work.find(_uid) || database->impl().work.membershipIf(_uid);
}

std::string CXRecord::description() const {
    return _uid.str() + " " + Value(dictionaryRepresentation()).description();
}

} // namespace rolvane
