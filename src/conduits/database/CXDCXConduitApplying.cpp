// Records of other sources, written into the contact database.

#include "acl/CXDCXACLManager.h"
#include "conduits/database/CXDCXConduit.h"
#include "conduits/database/ContactWrites.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/database/OneTurn.h"
#include "contacts/records/Constants.h"
#include "contacts/records/ContactMerge.h"
#include "contacts/records/Identifier.h"
#include "contacts/records/SharingDates.h"
#include "foundation/Log.h"
#include "foundation/PropertyList.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

#include <array>
#include <string_view>

namespace rolvane {
namespace {

// The properties of which a group may have chosen a value, in the order in which the choices are written.
constexpr std::array kChosenProperties{kCXAddressProperty, kCXEmailProperty, kCXPhoneProperty};

// Bytes of content that may wait in memory for the end of the pass: some 50,000 contacts without photos.
constexpr size_t kMostUnsaved = size_t{32} << 20;

bool namesAllGroup(const CXDChangeRecord& record) {
    return record.group() && cxUIDWithTableName(*record.group(), kCXGroupTable).str() == kCXAllGroupUID;
}

// The payload, read where it is delayed, and decoded for this one use where it stands encoded.
Dictionary contentOf(CXDChangeRecord& record) {
    if (const auto encoded = record.encodedPayload()) return BinaryValue::decode(*encoded).dictionary();
    return record.payload().dictionary();
}

// A contact that could not be read, or whose record lost the way to its content in a stored queue, is known by its
// stamp alone. Nothing in it says that the contact has become empty.
bool saysNothing(const CXDChangeRecord& record, const Dictionary& content) {
    if (record.delayedPayloadWasRead()) return false;
    for (const auto& [property, value] : content)
        if (property != kCXRemoteLocationProperty) return false;
    return true;
}

// Since when the users of a list are on it, as far as this computer knows.
void noteSharingDates(CXAllGroup& group, const char* list, const Dictionary& differences, Date now) {
    const char* property = std::string_view(list) == kCXReadSharingACLProperty ? kCXReadSharingDatesProperty
                                                                               : kCXReadWriteSharingDatesProperty;
    const auto held = group.multiValueForProperty(property);
    CXMutableMultiValue dates = held ? CXMutableMultiValue(*held) : CXMutableMultiValue();
    const auto isIn = [&](const char* key, const std::string& user) {
        return differences[key].array().contains(Value(user));
    };
    for (size_t i = dates.count(); i-- > 0;)
        if (isIn(kDeletions, dates.labelAtIndex(i)) || isIn(kAdditions, dates.labelAtIndex(i))) dates.removeAtIndex(i);
    for (const Value& added : differences[kAdditions].array()) dates.addValue(now, added.string());
    if (!dates.empty())
        group.setValue(dates, property);
    else if (held)
        group.removeValueForProperty(property);
}

} // namespace

bool CXDCXConduit::applyChangeRecord(const CXDChangeRecordPtr& record, bool* /*denied*/) {
    const bool done = dispatch(record);
    // Most passes are one save. What is saved early is safe: applied again after a crash it changes nothing.
    if (rolvane().unsavedSize() > kMostUnsaved) engine().saveInThePass();
    return done;
}

bool CXDCXConduit::dispatch(const CXDChangeRecordPtr& record) {
    if (_readOnlyKillSwitch && !_isOneOfSeveral && record->user() == kSelf) {
        CXDLog("kill switch caught bogus record: %@", record);
        return true;
    }
    switch (record->type()) {
    case CXDUpdateRecord: return updateRecord(record);
    case CXDCreateStructureForGroup: return createStructureForGroup(record);
    case CXDChangeGroupName: return changeGroupName(record);
    case CXDAddRecordToGroup: return addRecordToGroup(record);
    case CXDAddGroupToGroup: return addGroupToGroup(record);
    case CXDChangeGroupReadACL: return changeGroupReadACL(record);
    case CXDChangeGroupReadWriteACL: return changeGroupReadWriteACL(record);
    case CXDUpdateDistributionList: return updateDistributionList(record);
    case CXDRemoveRecordFromGroup: return removeRecordFromGroup(record);
    case CXDRemoveGroupFromGroup: return removeGroupFromGroup(record);
    case CXDDeleteRecord: return deleteRecord(record);
    case CXDDeleteGroup: return deleteGroup(record);
    default: return false;
    }
}

// -- whose is it

bool CXDCXConduit::mayChange(const CXDChangeRecord& record, const CXRecord& found) {
    if (!record.user() || record.user() == kSelf) return true;
    // A shared identifier finds the owner's own record when the copy is gone.
    if (!found.isSubscribed()) return false;
    const RemoteLocation location = found.remoteLocation();
    if (syncSourceForRemoteLocation(location) == 0) return true; // nobody's in particular
    const auto [known, isNew] = _publishers.try_emplace(location);
    if (isNew) known->second = engine().userForRemoteLocation(location);
    return known->second == record.user();
}

CXPersonRef CXDCXConduit::personOf(const CXDChangeRecord& record) {
    if (!record.person()) return nullptr;
    auto person = std::dynamic_pointer_cast<CXPerson>(recordForUniqueId(*record.person()));
    return person && mayChange(record, *person) ? person : nullptr;
}

CXGroupRef CXDCXConduit::groupOf(const CXDChangeRecord& record) {
    if (!record.group()) return nullptr;
    auto group = std::dynamic_pointer_cast<CXGroup>(recordForUniqueId(*record.group()));
    return group && mayChange(record, *group) ? group : nullptr;
}

CXGroupRef CXDCXConduit::subgroupOf(const CXDChangeRecord& record) {
    if (!record.person()) return nullptr;
    auto group = std::dynamic_pointer_cast<CXGroup>(recordForUniqueId(*record.person()));
    return group && mayChange(record, *group) ? group : nullptr;
}

bool CXDCXConduit::hasUncapturedEdit(const UniqueId& uid) {
    const int64_t now = rolvane().journalPosition();
    if (now > _editsKnown) {
        for (const UniqueId& changed : rolvane().changedByOthers(_editsKnown, now)) _uncaptured.insert(changed);
        _editsKnown = now;
    }
    return _uncaptured.contains(uid);
}

bool CXDCXConduit::swallows(const CXDChangeRecord& record) const {
    return _readOnlyKillSwitch && !_isOneOfSeveral && record.user() == kSelf &&
           record.initialSource() != CXDSyncSourceCX;
}

bool CXDCXConduit::holds(const CXDChangeRecord& record) {
    const auto isThere = [&] {
        return (record.person() && _written.contains(*record.person())) || personOf(record) != nullptr;
    };
    switch (record.type()) {
    case CXDAddRecordToGroup: return (namesAllGroup(record) || groupOf(record)) && isThere();
    case CXDAddGroupToGroup: {
        const CXGroupRef subgroup = subgroupOf(record);
        if (!subgroup || namesAllGroup(record)) return subgroup != nullptr;
        const CXGroupRef group = groupOf(record);
        return group && group->mayListSubgroup(subgroup);
    }
    case CXDUpdateDistributionList:
        // No choices are what everybody has who was not there.
        return record.inMemoryPayload().dictionary().empty() || (groupOf(record) && isThere());
    default: return true;
    }
}

bool CXDCXConduit::waitsForWhatFollows(const CXDChangeRecord& record) {
    if (record.type() != CXDAddGroupToGroup || namesAllGroup(record)) return false;
    const CXGroupRef group = groupOf(record), subgroup = subgroupOf(record);
    return group && subgroup && !group->mayListSubgroup(subgroup);
}

// -- people

bool CXDCXConduit::updateRecord(const CXDChangeRecordPtr& record) {
    if (!record->person()) return true;
    const UniqueId& uid = *record->person();
    CXPersonRef person = personOf(*record);
    if (!person && recordForUniqueId(uid)) {
        CXDLog("%@ names a record that is not its own; left as it is", record);
        return true;
    }
    Dictionary content = contentOf(*record);
    if (saysNothing(*record, content)) {
        CXDLog("The content of %@ could not be read; the contact stays as it is", record);
        return true;
    }
    if (!cxIsSubscribed(uid)) {
        content = content.mutableCopy();
        content.remove(kCXRemoteLocationProperty);
        // The shared form may have found a copy. It stays where it came from, or no unsubscribing would take it away.
        if (person && person->isSubscribed())
            content.set(kCXRemoteLocationProperty, person->valueForProperty(kCXRemoteLocationProperty));
    }
    if (!person && hasUncapturedEdit(uid)) {
        CXDLog("%@ has been deleted here meanwhile", record); // which is told to others after the pass
        return true;
    }
    if (!person) {
        person = CXPerson::initWithUniqueId(uid);
        rolvane().addRecord(person);
    }
    takeIn(*record, *person, content);
    _written.insert(uid);
    return true;
}

// An edit that was not sent meets a version of somebody else's: nothing of either is lost. The edit waits in the queue,
// is delivered after the pass, or is found by the next scan.
void CXDCXConduit::takeIn(const CXDChangeRecord& record, CXPerson& person, const Dictionary& content) {
    std::optional<CXCommonVersion> common;
    bool hasEdit = false;
    Dictionary ours;
    {
        // An edit that is saved between these lines would count as known to what arrives, and be lost.
        const OneTurn turn(rolvane());
        common = rolvane().commonVersion(person.uniqueId());
        hasEdit = common ? common->properties != nullptr : hasUncapturedEdit(person.uniqueId());
        if (hasEdit) ours = person.dictionaryRepresentation();
        person.resetWithDictionary(content, true, false); // what is not known goes
    }
    const auto theirs = person.encodedRepresentation();
    if (!hasEdit) return rolvane().setCommonVersion(person.uniqueId(), theirs);
    const Dictionary there = BinaryValue::decode(*theirs).dictionary(), here = cxAsSent(ours);
    CXMergeResult merge = cxMergedWithStore(common, here, there, CXSide::ours, std::nullopt);
    if (!merge.conflicts.empty()) {
        CXDConduit* source = engine().conduitForSyncSource(record.initialSource());
        const auto edited = common ? common->edited : std::optional(rolvane().personRow(person.uniqueId())->modified);
        const auto written = source ? source->dateOfContact(record) : std::nullopt;
        merge = cxMergedWithStore(common, here, there, laterSide(edited, written, here, there), written);
    }
    if (const Value& place = there[kCXRemoteLocationProperty]) merge.contact.set(kCXRemoteLocationProperty, place);
    rolvane().noteConflicts(person.uniqueId(), merge.conflicts);
    person.resetWithDictionary(merge.contact, true, false);
    rolvane().setCommonVersion(person.uniqueId(), theirs);
}

bool CXDCXConduit::deleteRecord(const CXDChangeRecordPtr& record) {
    if (const CXPersonRef person = personOf(*record)) rolvane().removeRecord(person);
    return true;
}

// -- groups

bool CXDCXConduit::createStructureForGroup(const CXDChangeRecordPtr& record) {
    if (!record->group() || namesAllGroup(*record)) return true;
    const UniqueId& uid = *record->group();
    const CXGroupRef there = groupOf(*record);
    if (!there && recordForUniqueId(uid)) {
        CXDLog("%@ names a record that is not its own; left as it is", record);
        return true;
    }
    if (!there && hasUncapturedEdit(uid)) {
        CXDLog("%@ has been deleted here meanwhile", record);
        return true;
    }
    const Dictionary content = contentOf(*record);
    const CXGroupRef group = CXGroup::initWithUniqueId(uid);
    if (cxIsSubscribed(uid)) group->setValue(content[kCXRemoteLocationProperty], kCXRemoteLocationProperty);
    const bool isRenamed = there && isRenamedHere(*record, *there);
    if ((isRenamed || !group->setValue(content[kCXGroupNameProperty], kCXGroupNameProperty)) && there)
        group->setValue(Value(there->name()), kCXGroupNameProperty);
    rolvane().addRecord(group);
    engine().saveInThePass();
    return true;
}

bool CXDCXConduit::changeGroupName(const CXDChangeRecordPtr& record) {
    if (namesAllGroup(*record)) return true;
    const CXGroupRef group = groupOf(*record);
    const Value name = record->payload();
    if (!group || !name || isRenamedHere(*record, *group)) return true;
    // As a replacement: a name that another program gives until the pass is saved stays.
    Dictionary content = group->dictionaryRepresentation().mutableCopy();
    content.set(kCXGroupNameProperty, name);
    group->resetWithDictionary(content, false, false);
    return true;
}

// A name that was given here since the pass has looked is an edit that was not sent yet, and goes out with the next
// one.
bool CXDCXConduit::isRenamedHere(const CXDChangeRecord& record, const CXGroup& group) {
    const Dictionary groups = priorState()[record.user().value_or(kSelf).str()].dictionary();
    const Value& known = groups[cxUIDWithTableName(group.sharingUniqueId(), kCXGroupTable).str()];
    const Value& name = known.dictionary()[kCXGroupNameProperty];
    return name && name != Value(group.name()) && hasUncapturedEdit(group.uniqueId());
}

bool CXDCXConduit::deleteGroup(const CXDChangeRecordPtr& record) {
    const CXGroupRef group = namesAllGroup(*record) ? rolvane().allGroup() : groupOf(*record);
    if (group) rolvane().removeRecord(group);
    return true;
}

// -- membership

bool CXDCXConduit::addRecordToGroup(const CXDChangeRecordPtr& record) {
    if (namesAllGroup(*record)) return true; // every person is in it already
    const CXPersonRef person = personOf(*record);
    const CXGroupRef group = groupOf(*record);
    if (person && group) group->addMember(person);
    return true;
}

bool CXDCXConduit::addGroupToGroup(const CXDChangeRecordPtr& record) {
    if (namesAllGroup(*record)) return true;
    const CXGroupRef group = groupOf(*record);
    const CXGroupRef subgroup = subgroupOf(*record);
    if (!group || !subgroup) return true;
    if (group->mayListSubgroup(subgroup))
        group->addSubgroup(subgroup);
    else
        CXDLog("%@ would make a group contain itself", record); // see waitsForWhatFollows
    return true;
}

bool CXDCXConduit::removeRecordFromGroup(const CXDChangeRecordPtr& record) {
    const CXPersonRef person = personOf(*record);
    if (!person) return true;
    if (namesAllGroup(*record))
        rolvane().removeRecord(person); // to leave the all-contacts group is to leave the database
    else if (const CXGroupRef group = groupOf(*record))
        group->removeMember(person);
    return true;
}

bool CXDCXConduit::removeGroupFromGroup(const CXDChangeRecordPtr& record) {
    const CXGroupRef subgroup = subgroupOf(*record);
    if (!subgroup) return true;
    if (namesAllGroup(*record))
        rolvane().removeRecord(subgroup);
    else if (const CXGroupRef group = groupOf(*record))
        group->removeSubgroup(subgroup);
    return true;
}

bool CXDCXConduit::updateDistributionList(const CXDChangeRecordPtr& record) {
    const CXGroupRef group = groupOf(*record);
    const CXPersonRef person = personOf(*record);
    const Value payload = record->payload();
    if (!group || !person || !payload) return true;
    const Dictionary choices = payload.dictionary();
    for (const char* property : kChosenProperties)
        group->setDistributionIdentifier(choices[property].optionalString(), property, person);
    return true;
}

// -- access lists

// Who may read is the store's matter; the database keeps what its own user may do.
bool CXDCXConduit::changeGroupReadACL(const CXDChangeRecordPtr& record) {
    if (!namesAllGroup(*record)) groupOf(*record);
    changeOwnList(*record, kCXReadSharingACLProperty);
    return true;
}

void CXDCXConduit::changeOwnList(const CXDChangeRecord& record, const char* property) {
    if (!_isOneOfSeveral || record.user() != kSelf || !namesAllGroup(record)) return;
    const CXAllGroupRef group = rolvane().allGroup();
    const auto held = group->multiValueForProperty(property);
    CXMutableMultiValue list = held ? CXMutableMultiValue(*held) : CXMutableMultiValue();
    const Dictionary differences = record.inMemoryPayload().dictionary();
    for (size_t i = list.count(); i-- > 0;)
        if (differences[kDeletions].array().contains(list.valueAtIndex(i))) list.removeAtIndex(i);
    for (const Value& added : differences[kAdditions].array())
        if (!list._allValues().contains(added)) list.addValue(added, added.string());
    if (!list.empty())
        group->setValue(list, property);
    else if (group->valueForProperty(property))
        group->removeValueForProperty(property);
    noteSharingDates(*group, property, differences, _with.clock.now());
}

bool CXDCXConduit::changeGroupReadWriteACL(const CXDChangeRecordPtr& record) {
    changeOwnList(*record, kCXReadWriteSharingACLProperty);
    const CXDConduit* store = engine().conduitForSyncSource(record->initialSource());
    const std::optional<Url> base = store ? store->baseLocationForUser(record->user()) : std::nullopt;
    if (!base) return true;
    const std::shared_ptr<CXACLManager> manager = ACLManagerForRemoteLocation(*base);
    const UniqueId group = record->group().value_or(UniqueId());
    const Dictionary differences = contentOf(*record);
    for (const Value& principal : differences[kAdditions].array())
        manager->grantReadWritePermissionForGUID(group, {}, UserName(principal.string()));
    for (const Value& principal : differences[kDeletions].array())
        manager->denyReadWritePermissionForGUID(group, {}, UserName(principal.string()));
    return true;
}

// Looked up under the text of the location's base location and kept under the location's own: where the two differ,
// every call makes another manager.
std::shared_ptr<CXACLManager> CXDCXConduit::ACLManagerForRemoteLocation(const Url& location) {
    if (auto known = CXDConduit::ACLManagerForRemoteLocation(location)) return known;
    auto manager =
        std::make_shared<CXDCXACLManager>(location, engine(), rolvane(), realUserFromUser(kSelf).value_or(kSelf));
    (*_ACLManagerMap)[location.absoluteString()] = manager;
    return manager;
}

} // namespace rolvane
