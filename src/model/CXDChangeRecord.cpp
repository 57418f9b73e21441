#include "model/CXDChangeRecord.h"

#include "contacts/records/Constants.h"
#include "foundation/CXException.h"
#include "foundation/Mutex.h"
#include "foundation/PropertyList.h"
#include "model/PayloadKeys.h"
#include "store/files/CXFileManager.h"

#include <array>
#include <fmt/format.h>
#include <utility>

namespace rolvane {

namespace {

struct Named {
    int32_t value;
    const char* name;
};

constexpr std::array kTypeNames = {
    Named{CXDUpdateRecord, "CXDUpdateRecord"},
    Named{CXDCreateStructureForGroup, "CXDCreateStructureForGroup"},
    Named{CXDCompositeGroupChange, "CXDCompositeGroupChange"},
    Named{CXDChangeGroupName, "CXDChangeGroupName"},
    Named{CXDAddRecordToGroup, "CXDAddRecordToGroup"},
    Named{CXDAddGroupToGroup, "CXDAddGroupToGroup"},
    Named{CXDChangeGroupReadACL, "CXDChangeGroupReadACL"},
    Named{CXDChangeGroupReadWriteACL, "CXDChangeGroupReadWriteACL"},
    Named{CXDUpdateDistributionList, "CXDUpdateDistributionList"},
    Named{CXDRemoveDistributionListFromGroup, "CXDRemoveDistributionListFromGroup"},
    Named{CXDRemoveRecordFromGroup, "CXDRemoveRecordFromGroup"},
    Named{CXDRemoveGroupFromGroup, "CXDRemoveGroupFromGroup"},
    Named{CXDDeleteRecord, "CXDDeleteRecord"},
    Named{CXDDeleteGroup, "CXDDeleteGroup"},
};

constexpr std::array kSourceNames = {
    Named{CXDSyncSourceCX, "CX"},           Named{CXDSyncSourceLocal, "Local"},
    Named{CXDSyncSourceVaultra, "Vaultra"}, Named{CXDSyncSourceConvoka, "Convoka"},
    Named{CXDSyncSourcePending, "Pending"},
};

constexpr const char* kTypeKey = "CXDChangeType";
constexpr const char* kInitialSourceKey = "CXDInitialSource";
constexpr const char* kAppliesToSourcesKey = "CXDAppliesToSources";
constexpr const char* kPersonKey = "CXDPersonUID";
constexpr const char* kGroupKey = "CXDGroupUID";
constexpr const char* kUserKey = "CXDUser";
constexpr const char* kPayloadKey = "CXDPayload";

template <class Strong>
Value valueOf(const std::optional<Strong>& text) {
    return text ? Value(*text) : Value();
}

template <class Strong>
std::optional<Strong> strongOf(const Value& value) {
    const SharedText* text = value.textIf();
    return text ? std::optional<Strong>(Strong(*text)) : std::nullopt;
}

[[noreturn]] void refuseMerge(const CXDChangeRecord& record, const char* missing) {
    throw CXException(
        kCXInvalidArgumentException,
        fmt::format("the change {} has no {} and cannot be merged into a group change", record.description(), missing));
}

void appendOnce(Dictionary& payload, const char* key, const std::optional<UniqueId>& member) {
    if (!member) return;
    Array list = payload.arrayFor(key);
    const Value identifier(*member);
    if (!list.contains(identifier)) list.append(identifier);
}

} // namespace

// Either form, or both after a look inside: then the value counts, because whoever holds it may have changed it.
// The lock guards the fields only; copies of one record may be looked at side by side.
struct CXDChangeRecord::Payload : SharedObject {
    explicit Payload(Value v) : value(std::move(v)) {}
    explicit Payload(std::shared_ptr<const Bytes> bytes) : encoded(std::move(bytes)) {}

    Value decoded() {
        const Lock guard(lock());
        if (!value && encoded) value = BinaryValue::decode(*encoded);
        return value;
    }
    std::shared_ptr<const Bytes> untouched() const {
        const Lock guard(lock());
        return value ? nullptr : encoded;
    }
    Bytes bytes() const {
        const Lock guard(lock());
        if (value) return BinaryValue::encode(value);
        return encoded ? *encoded : Bytes();
    }
    // As it stands in an archive: the object itself. Under the same key older archives have its BinaryValue bytes as a
    // data value; so has this one what is data by itself, or cannot be decoded.
    Value archived() const {
        const Bytes all = bytes();
        try {
            if (Value object = BinaryValue::decode(all); object && !object.isData()) return object;
        } catch (const CXException&) { // only a look inside finds the damage, when it is used
        }
        return Value(all);
    }
    void pack() {
        const Lock guard(lock());
        if (!value) return;
        Bytes now = BinaryValue::encode(value);
        if (!encoded || *encoded != now) encoded = std::make_shared<const Bytes>(std::move(now));
        value = Value();
    }

private:
    // A few locks for all: one in each of a hundred thousand payloads would be memory for nothing.
    Mutex& lock() const {
        static std::array<Mutex, 32> all;
        return all[(reinterpret_cast<uintptr_t>(this) >> 6) % all.size()];
    }
    Value value;
    std::shared_ptr<const Bytes> encoded;
};

struct CXDChangeRecord::Delayed {
    Url url;
    CXFileManager* manager;
};

CXDChangeRecord::CXDChangeRecord() = default;
CXDChangeRecord::~CXDChangeRecord() = default;
CXDChangeRecord::CXDChangeRecord(const CXDChangeRecord& other)
    : _changeType(other._changeType), _initialSource(other._initialSource), _appliesToSources(other.appliesToSources()),
      _appliedToSources(other._appliedToSources), _puid(other._puid), _guid(other._guid), _user(other._user),
      _payload(other._payload), _delayed(other._delayed ? std::make_unique<Delayed>(*other._delayed) : nullptr),
      _delayedPayloadWasRead(other._delayedPayloadWasRead) {}

CXDChangeRecord::CXDChangeRecord(int32_t initialSource, int32_t type, std::optional<UserName> user,
                                 std::optional<UniqueId> person, std::optional<UniqueId> group, Value payload)
    : _changeType(type), _initialSource(initialSource), _puid(std::move(person)), _guid(std::move(group)),
      _user(std::move(user)) {
    setPayload(std::move(payload));
}

void CXDChangeRecord::setPayload(Value payload) {
    _payload = payload ? SharedPointer<Payload>(new Payload(std::move(payload))) : SharedPointer<Payload>();
}

void CXDChangeRecord::setEncodedPayload(std::shared_ptr<const Bytes> encoded) {
    _payload = encoded ? SharedPointer<Payload>(new Payload(std::move(encoded))) : SharedPointer<Payload>();
}

void CXDChangeRecord::setDelayedPayloadURL(const Url& url, CXFileManager* manager) {
    if (_delayed && _delayed->url == url) return;
    _delayed = std::make_unique<Delayed>(Delayed{url, manager});
}

std::optional<Url> CXDChangeRecord::delayedPayloadURL() const {
    return _delayed ? std::optional(_delayed->url) : std::nullopt;
}

CXFileManager* CXDChangeRecord::fileManager() const {
    return _delayed ? _delayed->manager : nullptr;
}

Value CXDChangeRecord::payload() {
    if (!_delayed || !_delayed->manager) return inMemoryPayload();
    int ignored = 0;
    const std::optional<Dictionary> fetched = _delayed->manager->dictionaryAtURL(_delayed->url, &ignored, true);
    const Value held = inMemoryPayload();
    if (!fetched) return held;
    _delayedPayloadWasRead = true;
    Dictionary merged = fetched->mutableCopy();
    if (const Dictionary* over = held.dictionaryIf()) merged.addEntriesFrom(*over);
    setPayload(merged);
    return merged;
}

Value CXDChangeRecord::inMemoryPayload() const {
    return _payload ? _payload->decoded() : Value();
}

std::shared_ptr<const Bytes> CXDChangeRecord::encodedPayload() const {
    return _payload && !_delayed ? _payload->untouched() : nullptr;
}

void CXDChangeRecord::packPayload() {
    if (_payload) _payload->pack();
}

std::strong_ordering CXDChangeRecord::compare(const CXDChangeRecord& other) const {
    return static_cast<uint32_t>(_changeType) <=> static_cast<uint32_t>(other._changeType);
}

bool CXDChangeRecord::isEqual(const CXDChangeRecord& other) const {
    if (this == &other) return true;
    return _changeType == other._changeType && _initialSource == other._initialSource &&
           _appliesToSources == other._appliesToSources && _puid == other._puid && _guid == other._guid &&
           _user == other._user;
}

std::string CXDChangeRecord::description() const {
    std::string text = fmt::format("<{:x}>", reinterpret_cast<uintptr_t>(this));
    for (const Named& source : kSourceNames)
        if (_initialSource == source.value) text += source.name;
    text += " | ";
    for (const Named& type : kTypeNames)
        if (_changeType == type.value) text += type.name;
    text += " | ";
    for (const Named& source : kSourceNames)
        if (_appliesToSources & source.value) text.append(source.name).append(" ");
    text += " | ";
    if (_puid) text.append(_puid->str()).append(" | ");
    if (_guid) text.append(_guid->str()).append(" | ");
    if (_user) text.append(_user->str()).append(" | ");
    return text;
}

void CXDChangeRecord::encodeWithCoder(Coder& coder) const {
    if (!coder.allowsKeyedCoding()) return;
    coder.encodeInteger(_changeType, kTypeKey);
    coder.encodeInteger(_initialSource, kInitialSourceKey);
    coder.encodeInteger(_appliesToSources, kAppliesToSourcesKey);
    coder.encodeObject(valueOf(_puid), kPersonKey);
    coder.encodeObject(valueOf(_guid), kGroupKey);
    coder.encodeObject(valueOf(_user), kUserKey);
    if (_payload) coder.encodeObject(_payload->archived(), kPayloadKey);
}

CXDChangeRecord::CXDChangeRecord(const Coder& coder) {
    if (!coder.allowsKeyedCoding()) return;
    _changeType = static_cast<int32_t>(coder.decodeInteger(kTypeKey));
    _initialSource = static_cast<int32_t>(coder.decodeInteger(kInitialSourceKey));
    _appliesToSources = static_cast<int32_t>(coder.decodeInteger(kAppliesToSourcesKey));
    _puid = strongOf<UniqueId>(coder.decodeObject(kPersonKey));
    _guid = strongOf<UniqueId>(coder.decodeObject(kGroupKey));
    _user = strongOf<UserName>(coder.decodeObject(kUserKey));
    const Value payload = coder.decodeObject(kPayloadKey);
    if (payload.isData()) {
        const auto held = std::make_shared<const Value>(payload);
        setEncodedPayload(std::shared_ptr<const Bytes>(held, &held->data())); // the very bytes of the value
    } else if (payload) {
        // A queue may hold very many: they stand in memory as bytes until somebody looks inside.
        setEncodedPayload(std::make_shared<const Bytes>(BinaryValue::encode(payload)));
    }
}

CXDChangeRecordPtr CXDChangeRecord::copy() const {
    auto made = std::make_shared<CXDChangeRecord>(_initialSource, _changeType, _user, _puid, _guid);
    made->_payload = _payload;
    made->_appliesToSources = appliesToSources();
    return made;
}

CXDChangeRecords CXDChangeRecord::splitChangeRecord() const {
    CXDChangeRecords parts;
    for (const int32_t source : kSplitOrder) {
        if (!(_appliesToSources & source)) continue;
        parts.push_back(copy());
        parts.back()->setAppliesToSources(source);
    }
    return parts;
}

bool CXDChangeRecord::canBeMerged() {
    switch (_changeType) {
    case CXDCreateStructureForGroup: return payload().dictionary().contains(kCXGroupNameProperty);
    case CXDChangeGroupName: return static_cast<bool>(payload());
    case CXDUpdateDistributionList: return _puid && payload();
    case CXDRemoveDistributionListFromGroup: return _puid.has_value();
    default: return true;
    }
}

void CXDChangeRecord::mergeWithGroupChangeRecord(CXDChangeRecord& other) {
    const Value theirs = other.payload();
    const Value held = inMemoryPayload();
    if (held && !held.isDictionary()) refuseMerge(*this, "dictionary for its payload");
    Dictionary ours = held ? *held.dictionaryIf() : Dictionary();
    switch (other._changeType) {
    case CXDCreateStructureForGroup: {
        const Value name = theirs.dictionary()[kCXGroupNameProperty];
        if (!name) refuseMerge(other, "group name");
        ours.set(kCXGroupNameProperty, name);
        break;
    }
    case CXDChangeGroupName:
        if (!theirs) refuseMerge(other, "group name");
        ours.set(kCXGroupNameProperty, theirs);
        break;
    case CXDAddRecordToGroup: appendOnce(ours, kMemberAdds, other._puid); break;
    case CXDAddGroupToGroup: appendOnce(ours, kSubgroupAdds, other._puid); break;
    case CXDUpdateDistributionList:
        if (!other._puid) refuseMerge(other, "person");
        if (!theirs) refuseMerge(other, "payload");
        ours.dictionaryFor(kDistributionListAdds).set(other._puid->str(), theirs);
        break;
    case CXDRemoveDistributionListFromGroup:
        if (!other._puid) refuseMerge(other, "person");
        ours.arrayFor(kDistributionListRemoves).append(*other._puid);
        break;
    case CXDRemoveRecordFromGroup: appendOnce(ours, kMemberRemoves, other._puid); break;
    case CXDRemoveGroupFromGroup: appendOnce(ours, kSubgroupRemoves, other._puid); break;
    default: break;
    }
    _changeType = CXDCompositeGroupChange;
    if (other._changeType == CXDDeleteGroup)
        setPayload(Value());
    else if (!held)
        setPayload(ours);
}

bool CXDChangeRecord::canApplyOutOfOrder() const {
    if (_appliesToSources & CXDSyncSourceCX) return false;
    return _changeType != CXDChangeGroupReadACL && _changeType != CXDChangeGroupReadWriteACL;
}

bool CXDChangeRecord::changeMadeByDataOwner() const {
    return _user == kSelf;
}

std::optional<RemoteLocation> CXDChangeRecord::remoteLocation(const RecordLocator& locator) const {
    const int32_t source = _initialSource == CXDSyncSourceCX ? appliesToSources() : _initialSource;
    return locator.baseLocation(source, _user);
}

} // namespace rolvane
