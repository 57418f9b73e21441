#include "conduits/ChangeCapture.h"

#include "contacts/Identifier.h"
#include "model/RemoteLocationMap.h"

#include <algorithm>
#include <unordered_set>

namespace rolvane {
namespace {

// New members are read together with the others of their group unless they are very few or a small part of it: one row
// among many costs far less than a lookup, but not nothing.
constexpr size_t kFew = 4;
constexpr size_t kRowsPerLookup = 16;

UniqueId sharedPerson(const UniqueId& uid) {
    return cxUIDWithTableName(cxNormalizedUID(uid), kCXPersonTable);
}

UniqueId sharedGroup(const UniqueId& uid) {
    return cxUIDWithTableName(cxNormalizedUID(uid), kCXGroupTable);
}

} // namespace

ChangeCapture::ChangeCapture(ConduitEngine& engine, CXRolvane& rolvane, Dictionary priorState, std::string ownProgram)
    : _engine(engine), _reader(rolvane), _priorState(std::move(priorState)), _ownProgram(std::move(ownProgram)) {}

void ChangeCapture::add(CXDChangeRecords records) {
    std::move(records.begin(), records.end(), std::back_inserter(_records));
}

ChangeCapture::Destination ChangeCapture::destination(const RemoteLocation& location) {
    const auto known = _destinations.find(location);
    if (known != _destinations.end()) return known->second;
    const Destination to{_engine.userForRemoteLocation(location), syncSourceForRemoteLocation(location)};
    _destinations.emplace(location, to);
    return to;
}

// -- people

void ChangeCapture::addPerson(const std::optional<CXRow>& person, bool update) {
    if (person) addPerson(*person, update);
}

void ChangeCapture::addPerson(const CXRow& person, bool update) {
    for (const Captured& at : captured(person)) {
        _records.insert(_records.end(), at.records.begin(), at.records.end());
        if (update) continue;
        auto entry = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDAddRecordToGroup, at.destination.user,
                                                       sharedPerson(person.sharingUniqueId),
                                                       UniqueId(kCXAllGroupUID)); // a subscription's all group too
        entry->setAppliesToSources(at.destination.sources);
        _records.push_back(std::move(entry));
    }
}

const ChangeCapture::CapturedPerson& ChangeCapture::captured(const CXRow& person) {
    const auto [found, isNew] = _people.try_emplace(person.uniqueId);
    if (!isNew) return found->second;
    for (const RemoteLocation& location : _reader.locationsOfPerson(person)) {
        const Destination to = destination(location);
        auto update = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDUpdateRecord, to.user,
                                                        sharedPerson(person.sharingUniqueId), std::nullopt);
        update->setEncodedPayload(person.encoded);
        update->setAppliesToSources(to.sources);
        CXDChangeRecords records = distributionLists(person, to);
        records.insert(records.begin(), std::move(update));
        found->second.push_back({to, std::move(records)});
    }
    return found->second;
}

CXDChangeRecords ChangeCapture::distributionLists(const CXRow& person, const Destination& to) {
    CXDChangeRecords records;
    for (const UniqueId& group : person.parentGroups) {
        auto record = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDUpdateDistributionList, to.user,
                                                        sharedPerson(person.sharingUniqueId), sharedGroup(group),
                                                        _reader.choices(person, group));
        record->setAppliesToSources(to.sources);
        records.push_back(std::move(record));
    }
    return records;
}

void ChangeCapture::addDistributionLists(const CXRow& person, int32_t sources, const UserName& user) {
    add(distributionLists(person, {user, sources}));
}

// -- groups

void ChangeCapture::addGroup(const CXGroupRef& group) {
    if (!group) return;
    const auto location = _reader.locationOfGroup(*group);
    if (!location) return;
    // A group that contains itself, through whatever other process, would be compared without end.
    const auto [underway, isNew] = _underway.insert(group->uniqueId());
    if (!isNew) return;
    const UniqueId guid = cxUIDWithTableName(group->sharingUniqueId(), kCXGroupTable);
    const Dictionary priorOfUser = _priorState.dictionaryFor(destination(*location).user.str());
    // The all-contacts group's distribution lists are never compared, so they are not read.
    const Dictionary current = _reader.groupState(*group, guid.str() != kCXAllGroupUID);
    addComparison(priorOfUser[guid.str()], current, guid, *location, group.get());
    _underway.erase(underway);
}

void ChangeCapture::addComparison(const Value& prior, const Value& current, const UniqueId& guid,
                                  const RemoteLocation& location, const CXGroup* group) {
    const Destination to = destination(location);
    GroupAddress address{guid, to.user, to.sources, std::nullopt};
    if (!prior && current) address.allGroup = allGroupAt(location, to.user);
    const GroupSteps steps = compareGroupStates(prior, current, address);
    if (group) readNewMembers(steps, *group);
    for (const GroupStep& step : steps) {
        if (const auto* record = std::get_if<CXDChangeRecordPtr>(&step))
            _records.push_back(*record);
        else if (const auto* member = std::get_if<CaptureMember>(&step))
            addMember(member->person);
        else // the database's own record for the identifier, never a subscribed copy
            addGroup(std::dynamic_pointer_cast<CXGroup>(
                _reader.rolvane().recordForUniqueId(std::get<CaptureSubgroup>(step).group)));
    }
}

std::optional<UniqueId> ChangeCapture::allGroupAt(const RemoteLocation& location, const UserName& user) const {
    CXRolvane& rolvane = _reader.rolvane();
    const auto all = user == kSelf ? rolvane.allGroup() : rolvane.allGroupForRemoteLocation(location);
    return all ? std::optional<UniqueId>(all->sharingUniqueId()) : std::nullopt;
}

void ChangeCapture::addMember(const UniqueId& member) {
    if (const auto known = _reader.knownPersonFor(member)) {
        if (_arrived.contains(*known)) return;
        const auto found = _people.find(*known);
        if (found != _people.end()) {
            for (const Captured& at : found->second)
                _records.insert(_records.end(), at.records.begin(), at.records.end());
            return;
        }
    }
    const auto person = _reader.personForUniqueId(member);
    if (person && !cameFromPublisher(*person)) addPerson(*person, true);
}

bool ChangeCapture::cameFromPublisher(const CXRow& person) const {
    return !_ownProgram.empty() && person.writer == _ownProgram && cxIsSubscribed(person.uniqueId);
}

// Many new members: the data of those that are not captured yet is read together, so that announcing them finds it
// here.
void ChangeCapture::readNewMembers(const GroupSteps& steps, const CXGroup& group) {
    size_t added = 0;
    for (const GroupStep& step : steps) added += std::holds_alternative<CaptureMember>(step) ? 1 : 0;
    if (added < kFew) return;
    _reader.learnSubscribedPeople();
    std::unordered_set<UniqueId> wanted;
    for (const GroupStep& step : steps) {
        const auto* member = std::get_if<CaptureMember>(&step);
        if (member && !_people.contains(_reader.knownPersonFor(member->person).value_or(member->person)))
            wanted.insert(member->person);
    }
    if (wanted.size() < kFew || wanted.size() * kRowsPerLookup < group.memberCount()) return;
    _reader.expectMany();
    _reader.forEachMember(group, wanted, [this](const CXRow& row) {
        if (cameFromPublisher(row))
            _arrived.insert(row.uniqueId);
        else
            captured(row);
    });
}

} // namespace rolvane
