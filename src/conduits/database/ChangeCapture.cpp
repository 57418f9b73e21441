#include "conduits/database/ChangeCapture.h"

#include "contacts/records/Identifier.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

#include <algorithm>
#include <unordered_set>

namespace rolvane {
namespace {

// New members are read together with the others of their group unless they are very few or a small part of it: one row
// among many costs far less than a lookup, but not nothing.
constexpr size_t kFew = 4;
constexpr size_t kRowsPerLookup = 16;
// A group is captured with each new group that lists it: so many levels deep, and so often in one gathering. Whatever
// lies deeper is captured by itself: every all-contacts group lists every group.
constexpr size_t kDeepest = 200;
constexpr int kOftenEnough = 64;

UniqueId sharedPerson(const UniqueId& uid) {
    return cxUIDWithTableName(cxNormalizedUID(uid), kCXPersonTable);
}

UniqueId sharedGroup(const UniqueId& uid) {
    return cxUIDWithTableName(cxNormalizedUID(uid), kCXGroupTable);
}

} // namespace

ChangeCapture::ChangeCapture(ConduitEngine& engine, CXRolvane& rolvane, Dictionary priorState, std::string ownProgram)
    : _engine(engine), _reader(rolvane), _absences(rolvane), _priorState(std::move(priorState)),
      _ownProgram(std::move(ownProgram)) {}

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
    const CapturedPerson known = captured(person);
    if (update) return addCaptured(known.record, known.records);
    uint32_t record = known.record;
    for (uint32_t place = known.place; place < known.place + known.places; ++place) {
        const auto& [to, records] = _places[place];
        addCaptured(record, records);
        record += records;
        auto entry = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDAddRecordToGroup, to.user,
                                                       sharedPerson(person.sharingUniqueId),
                                                       UniqueId(kCXAllGroupUID)); // a subscription's all group too
        entry->setAppliesToSources(to.sources);
        _records.push_back(std::move(entry));
    }
}

void ChangeCapture::addCaptured(uint32_t first, uint32_t count) {
    const auto begin = _captured.begin() + first;
    _records.insert(_records.end(), begin, begin + count);
}

ChangeCapture::CapturedPerson ChangeCapture::captured(const CXRow& person) {
    if (const CapturedPerson* before = capturedBefore(person.uniqueId)) return *before;
    CapturedPerson made{person.uniqueId, static_cast<uint32_t>(_places.size()), 0,
                        static_cast<uint32_t>(_captured.size()), 0};
    for (const RemoteLocation& location : _reader.locationsOfPerson(person)) {
        const Destination to = destination(location);
        const size_t before = _captured.size();
        auto update = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDUpdateRecord, to.user,
                                                        sharedPerson(person.sharingUniqueId), std::nullopt);
        update->setEncodedPayload(person.encoded);
        update->setAppliesToSources(to.sources);
        _captured.push_back(std::move(update));
        addDistributionLists(person, to, _captured);
        _places.push_back({to, static_cast<uint32_t>(_captured.size() - before)});
    }
    made.places = static_cast<uint32_t>(_places.size()) - made.place;
    made.records = static_cast<uint32_t>(_captured.size()) - made.record;
    _byIdentifier.add(made.uniqueId.text().hash(), static_cast<uint32_t>(_people.size()));
    return _people.emplace_back(std::move(made));
}

// Groups mostly list people in the order in which they have been read.
const ChangeCapture::CapturedPerson* ChangeCapture::capturedBefore(const UniqueId& uniqueId) const {
    if (_following >= _people.size() || _people[_following].uniqueId != uniqueId) {
        const auto isIt = [&](uint32_t place) { return _people[place].uniqueId == uniqueId; };
        const uint32_t place = _byIdentifier.find(uniqueId.text().hash(), isIt);
        if (place == NumberTable::kNone) return nullptr;
        _following = place;
    }
    return &_people[_following++];
}

// The same identifier, whose text the records share where the person has been captured.
UniqueId ChangeCapture::sharedText(const UniqueId& uid) const {
    const CapturedPerson* before = _people.empty() ? nullptr : capturedBefore(uid);
    return before ? before->uniqueId : uid;
}

void ChangeCapture::addDistributionLists(const CXRow& person, const Destination& to, CXDChangeRecords& records) {
    for (const UniqueId& group : person.parentGroups) {
        auto record = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDUpdateDistributionList, to.user,
                                                        sharedPerson(person.sharingUniqueId), sharedGroup(group),
                                                        _reader.choices(person, group));
        record->setAppliesToSources(to.sources);
        records.push_back(std::move(record));
    }
}

void ChangeCapture::addDistributionLists(const CXRow& person, int32_t sources, const UserName& user) {
    addDistributionLists(person, {user, sources}, _records);
}

// -- groups

void ChangeCapture::addGroup(const CXGroupRef& group) {
    if (!group) return;
    const auto location = _reader.locationOfGroup(*group);
    if (!location) return;
    // A group that contains itself, through whatever other process, would be compared without end. So would, nearly,
    // groups of somebody's that contain one another on very many ways; what was captured so often is all there.
    if (_underway.size() >= kDeepest || ++_comparisons[group->uniqueId()] > kOftenEnough) return;
    const auto [underway, isNew] = _underway.insert(group->uniqueId());
    if (!isNew) return;
    const UniqueId guid = cxUIDWithTableName(group->sharingUniqueId(), kCXGroupTable);
    const Dictionary priorOfUser = _priorState.dictionaryFor(destination(*location).user.str());
    const Value& prior = priorOfUser[guid.str()];
    // The all-contacts group's distribution lists are never compared, so they are not read.
    const Dictionary current =
        _reader.groupState(*group, guid.str() != kCXAllGroupUID, prior.dictionary()[kMemberUIDState].array(),
                           [this](const UniqueId& uid) { return sharedText(uid); });
    addComparison(prior, current, guid, *location, group.get());
    _underway.erase(underway);
}

void ChangeCapture::addComparison(const Value& prior, const Value& current, const UniqueId& guid,
                                  const RemoteLocation& location, const CXGroup* group) {
    const Destination to = destination(location);
    GroupAddress address{guid, to.user, to.sources, std::nullopt};
    if (!prior && current) address.allGroup = allGroupAt(location, to.user);
    const GroupSteps steps = compareGroupStates(prior, current, address);
    if (group) confirmAbsences(steps, *group);
    if (group) readNewMembers(steps, *group, current.dictionary()[kMemberUIDState].array().count());
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

// An index that has lost an entry would have everybody lose a contact.
void ChangeCapture::confirmAbsences(const GroupSteps& steps, const CXGroup& group) {
    const bool isCopy = group.isSubscribed();
    const std::string location = isCopy && group.isAllGroup() ? group.remoteLocation().str() : std::string();
    std::vector<UniqueId> left;
    bool isLocated = false;
    for (const GroupStep& step : steps) {
        const auto* record = std::get_if<CXDChangeRecordPtr>(&step);
        if (!record) continue;
        const int32_t type = (*record)->type();
        const bool isPerson = type == CXDRemoveRecordFromGroup;
        if (!isPerson && type != CXDRemoveGroupFromGroup) continue;
        const UniqueId own = cxUIDWithTableName(*(*record)->person(), isPerson ? kCXPersonTable : kCXGroupTable);
        const UniqueId copy = cxUIDWithTableName(own, isPerson ? kCXSubscribedPersonTable : kCXSubscribedGroupTable);
        if (isCopy && !std::exchange(isLocated, true)) _absences.requireItsLocation(group.uniqueId());
        if (group.isAllGroup())
            _absences.requireGoneFrom(location, isCopy ? copy : own);
        else
            for (const UniqueId& form : {own, copy}) left.push_back(form);
    }
    if (left.empty()) return;
    // Where a group lists both, one may leave it and the other stay.
    const std::vector<UniqueId> people = group.memberUniqueIds(), subgroups = group.subgroupUniqueIds();
    std::unordered_set<UniqueId> listed(people.begin(), people.end());
    listed.insert(subgroups.begin(), subgroups.end());
    std::erase_if(left, [&](const UniqueId& form) { return listed.contains(form); });
    _absences.requireUnlisted(group.uniqueId(), left);
}

std::optional<UniqueId> ChangeCapture::allGroupAt(const RemoteLocation& location, const UserName& user) const {
    CXRolvane& rolvane = _reader.rolvane();
    const auto all = user == kSelf ? rolvane.allGroup() : rolvane.allGroupForRemoteLocation(location);
    return all ? std::optional<UniqueId>(all->sharingUniqueId()) : std::nullopt;
}

void ChangeCapture::addMember(const UniqueId& member) {
    if (const auto known = _reader.knownPersonFor(member)) {
        if (_arrived.contains(*known)) return;
        if (const CapturedPerson* before = capturedBefore(*known)) return addCaptured(before->record, before->records);
    }
    const auto person = _reader.personForUniqueId(member);
    if (person && !cameFromPublisher(*person)) addPerson(*person, true);
}

bool ChangeCapture::cameFromPublisher(const CXRow& person) const {
    return !_ownProgram.empty() && person.writer == _ownProgram && cxIsSubscribed(person.uniqueId);
}

// Many new members: the data of those that are not captured yet is read together, so that announcing them finds it
// here.
void ChangeCapture::readNewMembers(const GroupSteps& steps, const CXGroup& group, size_t members) {
    size_t added = 0;
    for (const GroupStep& step : steps) added += std::holds_alternative<CaptureMember>(step) ? 1 : 0;
    if (added < kFew) return;
    _reader.learnSubscribedPeople();
    std::unordered_set<UniqueId> wanted;
    for (const GroupStep& step : steps) {
        const auto* member = std::get_if<CaptureMember>(&step);
        if (member && !capturedBefore(_reader.knownPersonFor(member->person).value_or(member->person)))
            wanted.insert(member->person);
    }
    if (wanted.size() < kFew || wanted.size() * kRowsPerLookup < members) return;
    _reader.expectMany();
    _reader.forEachMember(group, wanted, [this](const CXRow& row) {
        if (cameFromPublisher(row))
            _arrived.insert(row.uniqueId);
        else
            captured(row);
    });
}

} // namespace rolvane
