#include "engine/recovery/PassRecovery.h"

#include "contacts/database/CXRolvane.h"
#include "contacts/records/Identifier.h"
#include "engine/memory/PassCommit.h"
#include "engine/recovery/Holdings.h"
#include "engine/recovery/UnsettledGroups.h"
#include "foundation/TestSwitch.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

#include <algorithm>
#include <iterator>
#include <unordered_set>

namespace rolvane {

namespace {

// Groups in other users' trees: their waiting changes are sent as they are, and the next scan compares the groups.
Dictionary unsettledOfOthers(const CXDChangeRecords& records, size_t fresh) {
    if (records.size() <= fresh) return {}; // nothing waited
    CXDChangeRecords others;
    size_t freshOthers = 0;
    for (size_t i = 0; i < records.size(); ++i)
        if (records[i]->user() != kSelf) {
            others.push_back(records[i]);
            if (i < fresh) ++freshOthers;
        }
    return unsettledGroups(others, freshOthers);
}

} // namespace

void PassRecovery::begin(CXDChangeRecords& records, size_t fresh) {
    // Of a pass that was killed, or what an earlier one left unsettled.
    _underWay = underWayInAnyForm(_parts.state.underWay());
    _unsettled = unsettledOfOthers(records, fresh);
    restatement().restate(records, fresh);
    settle(records, fresh);
}

void PassRecovery::restateForTheFolder(CXDChangeRecords& waiting) const {
    const Restatement restatement = this->restatement();
    restatement.withdrawWhatIsGone(waiting, 0);
    restatement.dropRemovalsOfWhatIsBack(waiting, 0);
}

void PassRecovery::settle(CXDChangeRecords& records, size_t fresh) {
    bool hasArrived = false;
    for (const SharedTree& tree : treesOf(*_underWay))
        _parts.state.withConduitData([&](Dictionary& data) {
            const auto settled = settleUnderWay(*_underWay, tree, records, fresh, data, _parts.with.rolvane);
            _end.unread = underWayTogether(_end.unread, settled.left);
            hasArrived |= settled.hasArrived;
            if (!isLeftOut("names of others")) _namesOfOthers.addEntriesFrom(settled.namesOfOthers);
        });
    if (hasArrived && !isLeftOut("arrivals")) storeNoteNow(true);
}

void PassRecovery::willWrite(const CXDChangeRecords& outOfOrder) {
    const Dictionary now = withoutNames(withSubscriptions(underWay(outOfOrder)), _namesOfOthers);
    _underWay = underWayTogether(*_underWay, now);
    _end.removed = removedBy(outOfOrder);
    const bool gatheringChanged = _parts.with.rolvane.hasUnsavedChanges();
    _parts.conduits.vaultra->willWrite(outOfOrder);
    if (!now.empty() && !isLeftOut("note before the workers")) storeNoteNow(gatheringChanged);
}

void PassRecovery::storeNoteNow(bool gatheringChanged) {
    PassCommit commit(_parts.with.rolvane, _parts.with.preferences, _parts.state);
    claimState(_parts);
    _parts.state.setUnderWay(*_underWay);
    // Access lists and removals that came from the store are saved together with the states that know them.
    if (gatheringChanged) _parts.state.putConduitDataWith(_parts.marksOfThePass);
    _parts.with.rolvane.save();
    commit.commit();
}

void PassRecovery::lostInFolds(const LostInFolds& lost) {
    for (const auto& groups : {lost.lists, lost.contents})
        for (const UniqueId& group : groups)
            if (!isLeftOut("lost in folds")) _unsettled.set(group.str(), true);
    for (const UniqueId& group : lost.contents) noteUnsettled(group);
}

void PassRecovery::compareAgain(const UniqueId& group) {
    _unsettled.set(group.str(), true);
    noteUnsettled(group);
}

void PassRecovery::noteUnsettled(const UniqueId& group) {
    if (isLeftOut("unsettled changes")) return;
    _end.unsettledGroups.insert(cxUIDWithTableName(group, kCXGroupTable));
}

bool PassRecovery::end(const CXDChangeRecords& left) {
    if (!_parts.vaultraOffLine()) _end.unread = underWayTogether(_end.unread, mayHaveArrived(left));
    _end.unsettledGroups.merge(groupsOf(ownWrites(left)));
    _end.everythingIsPublished = isPublished(*_parts.with.rolvane.allGroup());
    if (_unsettled.empty() || isLeftOut("unsettled groups")) return false;
    _parts.state.conduitObjectForKey(kConduitCX, kUnsettledGroups).addEntriesFrom(_unsettled);
    return true;
}

// Of what waits in other users' trees: the answers may have been lost, and not the changes.
Dictionary PassRecovery::mayHaveArrived(const CXDChangeRecords& left) const {
    if (isLeftOut("may have arrived")) return {};
    CXDChangeRecords ofGroups;
    std::copy_if(left.begin(), left.end(), std::back_inserter(ofGroups), [](const CXDChangeRecordPtr& record) {
        return record->user() != kSelf && record->type() != CXDUpdateRecord;
    });
    const Dictionary waits = withSubscriptions(underWay(ofGroups));
    const Dictionary all = isLeftOut("names before") ? waits : withNamesBefore(waits, _underWay.value_or(Dictionary()));
    Dictionary subscribed;
    for (const auto& [user, of] : all)
        if (of.dictionary().contains(kSubscription)) subscribed.set(user, of);
    return subscribed;
}

void PassRecovery::storeNote() {
    if (_underWay)
        _parts.state.setUnderWay(isLeftOut("unsettled writes")
                                     ? Dictionary()
                                     : unsettledAfter(*_underWay, _parts.state.conduitData(), _end));
}

// The own one, and those of others whose subscription is still the one by which the copies came.
std::vector<SharedTree> PassRecovery::treesOf(const Dictionary& underWay) const {
    std::vector<SharedTree> trees;
    CXRolvane& rolvane = _parts.with.rolvane;
    const auto isRead = [&](const UserName& user) { return _parts.outcomes.lookAt(user) == TreeLook::read; };
    if (underWay.contains(kSelf.str())) trees.push_back({kSelf, rolvane.allGroup(), isRead(kSelf)});
    for (const auto& [user, subscription] : subscriptionsOf(underWay))
        if (underWay[user.str()].dictionary()[kSubscription] == Value(subscription->uniqueId()))
            trees.push_back({user, rolvane.allGroupForRemoteLocation(subscription->remoteLocation()), isRead(user)});
    return trees;
}

Restatement PassRecovery::restatement() const {
    return {_parts.with.rolvane, *_parts.conduits.cx, hasCopies()};
}

// The database has contacts of these users: of its own one, and of those whose subscription has not been replaced.
std::function<bool(const UserName&)> PassRecovery::hasCopies() const {
    std::unordered_set<UserName> users{kSelf};
    for (const CXSubscriptionRef& subscription : _parts.with.rolvane.subscriptions()) {
        const RemoteLocation location = subscription->remoteLocation();
        const auto user = userForRemoteLocation(location, _parts.with.account.vaultraUser(), _parts.with.loginName);
        if (user && !_parts.state.isOfFormerSubscription(location, subscription->uniqueId())) users.insert(*user);
    }
    return [users = std::move(users)](const UserName& user) { return users.contains(user); };
}

// Adds the present subscription to each tree of somebody else. Copies of a former subscription are gone, though nobody
// has deleted them.
Dictionary PassRecovery::withSubscriptions(Dictionary underWay) const {
    for (const auto& [user, subscription] : subscriptionsOf(underWay))
        underWay.dictionaryFor(user.str()).set(kSubscription, subscription->uniqueId());
    return underWay;
}

std::vector<std::pair<UserName, CXSubscriptionRef>> PassRecovery::subscriptionsOf(const Dictionary& underWay) const {
    std::vector<std::pair<UserName, CXSubscriptionRef>> all;
    if (underWay.empty()) return all;
    for (const CXSubscriptionRef& subscription : _parts.with.rolvane.subscriptions()) {
        const auto user = userForRemoteLocation(subscription->remoteLocation(), _parts.with.account.vaultraUser(),
                                                _parts.with.loginName);
        if (user && *user != kSelf && underWay.contains(user->str())) all.emplace_back(*user, subscription);
    }
    return all;
}

} // namespace rolvane
