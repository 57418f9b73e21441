#include "conduits/database/ContactReader.h"

#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "model/PayloadKeys.h"

#include <algorithm>

namespace rolvane {
namespace {

Dictionary asDictionary(const CXDistributionChoices& choices) {
    Dictionary dictionary;
    for (const auto& [property, identifier] : choices) dictionary.set(property, identifier);
    return dictionary;
}

Dictionary choicesUnder(const std::map<UniqueId, CXDistributionChoices>& all, const UniqueId& key) {
    const auto found = all.find(key);
    return found == all.end() ? Dictionary() : asDictionary(found->second);
}

Array asArray(const std::vector<UniqueId>& identifiers, const ContactReader::TextSharing& share) {
    std::vector<Value> all;
    all.reserve(identifiers.size());
    for (const UniqueId& identifier : identifiers) all.emplace_back(share ? share(identifier) : identifier);
    return Array(std::move(all));
}

// Published or subscribed to; a location under any other label is somebody's note, not a place of sharing.
std::vector<RemoteLocation> sharedLocationsOf(const CXRecord* record) {
    std::vector<RemoteLocation> shared;
    const auto locations = record ? record->multiValueForProperty(kCXRemoteLocationProperty) : std::nullopt;
    if (!locations) return shared;
    for (const auto& entry : locations->entries())
        if (entry.label == kCXPublishLabel || entry.label == kCXSubscribeLabel)
            shared.emplace_back(entry.value.string());
    return shared;
}

std::optional<RemoteLocation> firstLocation(const CXRecord& record) {
    const auto locations = record.multiValueForProperty(kCXRemoteLocationProperty);
    if (!locations || locations->empty()) return std::nullopt;
    return RemoteLocation(locations->valueAtIndex(0).string());
}

void addPrincipals(Dictionary& state, const CXRecord& group, const char* property) {
    if (const auto principals = group.multiValueForProperty(property)) state.set(property, principals->_allValues());
}

void addMissing(std::vector<RemoteLocation>& all, const std::vector<RemoteLocation>& more) {
    for (const RemoteLocation& location : more)
        if (std::find(all.begin(), all.end(), location) == all.end()) all.push_back(location);
}

} // namespace

// -- lookup

CXRecordRef ContactReader::recordForUniqueId(const UniqueId& uid) const {
    if (uid.str() == kCXAllGroupUID) return _rolvane.allGroup();
    if (uid.endsWith(kCXSubscribedPersonTable) || uid.endsWith(kCXSubscribedGroupTable))
        return _rolvane.recordForUniqueId(uid);
    const auto subscribedBeforePlain = [&](std::string_view subscribed, std::string_view plain) {
        const CXRecordRef copy = _rolvane.recordForUniqueId(cxUIDWithTableName(uid, subscribed));
        return copy ? copy : _rolvane.recordForUniqueId(cxUIDWithTableName(uid, plain));
    };
    if (uid.endsWith("Person")) return subscribedBeforePlain(kCXSubscribedPersonTable, kCXPersonTable);
    if (uid.endsWith("Group")) return subscribedBeforePlain(kCXSubscribedGroupTable, kCXGroupTable);
    return _rolvane.recordForUniqueId(uid);
}

std::optional<CXRow> ContactReader::personForUniqueId(const UniqueId& uid) const {
    if (uid.endsWith(kCXSubscribedPersonTable)) return _rolvane.personRow(uid);
    if (auto copy = _rolvane.personRow(cxUIDWithTableName(uid, kCXSubscribedPersonTable))) return copy;
    return _rolvane.personRow(cxUIDWithTableName(uid, kCXPersonTable));
}

std::optional<UniqueId> ContactReader::knownPersonFor(const UniqueId& uid) const {
    if (uid.endsWith(kCXSubscribedPersonTable)) return uid;
    if (!_subscribedPeople) return std::nullopt;
    const bool hasCopy = !_subscribedPeople->empty() && _subscribedPeople->contains(std::string(cxUUIDPart(uid)));
    return cxUIDWithTableName(uid, hasCopy ? kCXSubscribedPersonTable : kCXPersonTable);
}

void ContactReader::forEachMember(const CXGroup& group, const std::unordered_set<UniqueId>& wanted,
                                  const std::function<void(const CXRow&)>& call) {
    const auto& subscribed = subscribedPeople();
    _rolvane.forEachMember(group, [&](const CXRow& row) {
        if (!wanted.contains(cxNormalizedUID(row.sharingUniqueId))) return;
        const bool hidden = !subscribed.empty() && !cxIsSubscribed(row.uniqueId) &&
                            subscribed.contains(std::string(cxUUIDPart(row.uniqueId)));
        if (!hidden) call(row);
    });
}

const std::unordered_set<std::string>& ContactReader::subscribedPeople() {
    if (!_subscribedPeople) {
        _subscribedPeople.emplace();
        for (const UniqueId& person : _rolvane.peopleOfTable(kCXSubscribedPersonTable))
            _subscribedPeople->emplace(cxUUIDPart(person));
    }
    return *_subscribedPeople;
}

// -- locations

std::vector<RemoteLocation> ContactReader::locationsOfPerson(const CXRow& person) {
    std::vector<RemoteLocation> locations;
    for (const UniqueId& group : person.parentGroups) addMissing(locations, sharedLocations(group));
    addMissing(locations, sharedLocationsOfAllGroup(person.location));
    return locations;
}

const std::vector<RemoteLocation>& ContactReader::sharedLocations(const UniqueId& group) {
    const auto [found, isNew] = _sharedLocations.try_emplace(group);
    if (isNew) found->second = sharedLocationsOf(_rolvane.recordForUniqueId(group).get());
    return found->second;
}

// The empty location is the owner's own.
const std::vector<RemoteLocation>& ContactReader::sharedLocationsOfAllGroup(const RemoteLocation& location) {
    const auto [found, isNew] = _allGroupLocations.try_emplace(location);
    if (isNew)
        found->second = sharedLocationsOf(location.empty() ? _rolvane.allGroup().get()
                                                           : _rolvane.allGroupForRemoteLocation(location).get());
    return found->second;
}

std::optional<RemoteLocation> ContactReader::locationOfGroup(const CXGroup& group) const {
    if (auto own = firstLocation(group)) return own;
    return firstLocation(*_rolvane.allGroup());
}

// -- group states

Dictionary ContactReader::groupState(const CXGroup& group, bool withDistributionLists, const Array& known,
                                     const TextSharing& share) const {
    Dictionary state;
    state.set(kMemberUIDState, asArray(group.memberIdentifiersLike(known), share));
    state.set(kSubgroupUIDState, asArray(group.subgroupIdentifiers(), {}));
    if (const std::string name = group.name(); !name.empty()) state.set(kCXGroupNameProperty, name);
    addPrincipals(state, group, kCXReadWriteSharingACLProperty);
    addPrincipals(state, group, kCXReadSharingACLProperty);
    if (withDistributionLists) state.set(kDistributionListState, distributionListState(group));
    return state;
}

Dictionary ContactReader::distributionListState(const CXGroup& group) {
    const auto choices = group.distributionChoices();
    Dictionary state;
    for (const UniqueId& member : group.memberUniqueIds())
        state.set(cxUIDWithTableName(member, kCXPersonTable).str(), choicesUnder(choices, member));
    return state;
}

Dictionary ContactReader::choices(const CXRow& person, const UniqueId& group) {
    if (!_many) return choicesUnder(choicesOfPerson(person.uniqueId), group);
    const auto [found, isNew] = _groupChoices.try_emplace(group);
    if (isNew)
        if (const auto record = std::dynamic_pointer_cast<CXGroup>(_rolvane.recordForUniqueId(group)))
            found->second = record->distributionChoices();
    return choicesUnder(found->second, person.uniqueId);
}

const std::map<UniqueId, CXDistributionChoices>& ContactReader::choicesOfPerson(const UniqueId& person) {
    if (_person != person) {
        const auto record = std::dynamic_pointer_cast<CXPerson>(_rolvane.recordForUniqueId(person));
        _personChoices =
            record ? CXGroup::distributionChoicesForPerson(*record) : std::map<UniqueId, CXDistributionChoices>();
        _person = person;
    }
    return _personChoices;
}

} // namespace rolvane
