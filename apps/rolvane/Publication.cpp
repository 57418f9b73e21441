#include "Publication.h"

#include "Shares.h"

#include "conduits/TakingIn.h"
#include "conduits/store/EndedPublication.h"
#include "conduits/store/StoreComparison.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "contacts/records/SharingDates.h"
#include "engine/memory/EngineState.h"
#include "engine/memory/PriorStates.h"
#include "engine/queue/RefusedChanges.h"
#include "model/Computers.h"
#include "model/RemoteLocationMap.h"

#include <algorithm>
#include <set>

namespace rolvane::cli {

namespace {

bool isPublished(const CXGroup& group) {
    const auto locations = group.multiValueForProperty(kCXRemoteLocationProperty);
    if (!locations) return false;
    for (size_t i = 0; i < locations->count(); ++i)
        if (locations->labelAtIndex(i) == kCXPublishLabel) return true;
    return false;
}

CXMultiValue publishedAt(const Url& base) {
    CXMutableMultiValue locations;
    locations.addValue(base.absoluteString(), kCXPublishLabel);
    return locations;
}

bool publishAt(CXGroup& group, const Url& base) {
    const auto held = group.multiValueForProperty(kCXRemoteLocationProperty);
    if (held && held->count() == 1 && held->labelAtIndex(0) == kCXPublishLabel &&
        held->valueAtIndex(0).string() == base.absoluteString())
        return false;
    return group.setValue(publishedAt(base), kCXRemoteLocationProperty);
}

// Takes out what the test chooses; the queue is written only when that is something.
void dropPending(EngineState& state, const std::function<bool(const CXDChangeRecord&)>& drop) {
    CXDChangeRecords waiting = state.getPendingChanges();
    if (std::erase_if(waiting, [&](const CXDChangeRecordPtr& record) { return drop(*record); }) > 0)
        state.setPendingChanges(waiting);
}

} // namespace

bool Publication::everything() const {
    return isPublished(*_database.allGroup());
}

std::vector<CXGroupRef> Publication::groups() const {
    std::vector<CXGroupRef> found;
    for (const CXListing& listing : _database.listGroups(RemoteLocation("")))
        if (const auto group = std::dynamic_pointer_cast<CXGroup>(_database.recordForUniqueId(listing.uniqueId));
            group && isPublished(*group))
            found.push_back(group);
    return found;
}

bool Publication::publishes(const CXGroupRef& group) const {
    return isPublished(*group);
}

bool Publication::publishEverything(const Url& base) {
    const bool changed = publishAt(*_database.allGroup(), base);
    if (changed) settle();
    return changed;
}

bool Publication::publishGroup(const CXGroupRef& group, const Url& base) {
    const bool changed = publishAt(*group, base);
    if (changed) settle();
    Shares(_database).settle();
    return changed;
}

bool Publication::withdrawEverything() {
    if (!everything()) return false;
    _database.allGroup()->removeValueForProperty(kCXRemoteLocationProperty);
    settle();
    return true;
}

bool Publication::withdrawGroup(const CXGroupRef& group) {
    if (!isPublished(*group)) return false;
    for (const char* property : {kCXRemoteLocationProperty, kCXReadSharingACLProperty, kCXReadWriteSharingACLProperty})
        group->removeValueForProperty(property);
    settle();
    return true;
}

void Publication::settle() {
    const CXAllGroupRef all = _database.allGroup();
    const bool groupsOnly = !everything() && !groups().empty();
    if (!everything()) {
        if (groupsOnly)
            all->setValue(CXMultiValue(), kCXRemoteLocationProperty);
        else
            all->removeValueForProperty(kCXRemoteLocationProperty);
    }
    const RemoteLocation location(kGroupsLocation);
    const CXSubscriptionRef held = _database.findSubscriptionWithRemoteLocation(location);
    if (groupsOnly && !held) _database.addRecord(CXSubscription::create(location, false, "Published groups"));
    if (!groupsOnly && held) _database.removeRecord(held);
}

std::vector<UniqueId> Publication::peopleOnlyIn(const CXGroupRef& group) const {
    std::vector<UniqueId> only;
    if (everything()) return only;
    std::set<UniqueId> elsewhere;
    for (const CXGroupRef& other : groups())
        if (other->uniqueId() != group->uniqueId())
            for (const UniqueId& member : other->memberIdentifiers()) elsewhere.insert(member);
    for (const UniqueId& member : group->memberIdentifiers())
        if (!elsewhere.contains(member)) only.push_back(member);
    return only;
}

void forgetPublication(Preferences& preferences) {
    EngineState state(preferences);
    const Value serial =
        state.conduitObjectForKey(kConduitVaultra, "priorState")[kSelf.str()].dictionary()[kSerialNumber];
    if (serial.isString()) preferences.set(kDaemonDomain, kCXDFormerTree, serial);
    for (const char* conduit : {kConduitCX, kConduitVaultra})
        state.conduitObjectForKey(conduit, "priorState").remove(kSelf.str());
    state.withConduitData([](Dictionary& data) { forgetRefusedChanges(data); });
    state.setConduitObjectForKey(kConduitCX, Dictionary(), kTakingIn);
    state.noteRefusedByOwnStore(0, std::nullopt);
    for (const char* note : {kCXDUnsavedAccessLists, kCXDUnderWay, kCXDEndedPublication})
        preferences.remove(kDaemonDomain, note);
    dropPending(state, [](const CXDChangeRecord& record) { return record.changeMadeByDataOwner(); });
    state.syncPrefs();
}

void forgetPublishedGroup(Preferences& preferences, const UniqueId& group) {
    EngineState state(preferences);
    const UniqueId normalised = cxNormalizedUID(group);
    state.withConduitData([&](Dictionary& data) { removeGUID(data, normalised); });
    for (const char* conduit : {kConduitCX, kConduitVaultra}) {
        const Dictionary all =
            state.conduitObjectForKey(conduit, "priorState")[kSelf.str()].dictionary()["AllCXGroup"].dictionary();
        all["subgroupUIDState"].array().removeAll(normalised.str());
    }
    dropPending(state, [&](const CXDChangeRecord& record) {
        return record.changeMadeByDataOwner() && (record.group() == normalised || record.person() == normalised);
    });
    state.syncPrefs();
}

} // namespace rolvane::cli
