#include "conduits/database/GroupComparison.h"

#include "conduits/PublishedLayout.h"
#include "contacts/records/Constants.h"
#include "contacts/records/RecordKind.h"
#include "model/PayloadKeys.h"

namespace rolvane {
namespace {

UniqueId identifierIn(const Value& element) { // shares the text
    const SharedText* text = element.textIf();
    return text ? UniqueId(*text) : UniqueId();
}

// Collects the records and the places of one comparison.
class Comparison {
public:
    Comparison(const Value& prior, const Value& current, const GroupAddress& address)
        : _isKnown(prior), _prior(prior.dictionary()), _current(current.dictionary()), _address(address),
          _isAllGroup(address.guid.str() == layout::kAllGroup) {}

    void newGroup() {
        Dictionary payload;
        if (const Value& name = _current[kCXGroupNameProperty]) payload.set(kCXGroupNameProperty, name);
        add(CXDCreateStructureForGroup, {}, _address.guid, payload);
        if (_address.guid != _address.allGroup) add(CXDAddGroupToGroup, _address.guid, _address.allGroup);
    }

    void members() {
        const Dictionary differences = differencesOf(kMemberUIDState);
        for (const Value& added : differences[kAdditions].array()) {
            const UniqueId member = identifierIn(added);
            _steps.push_back(CaptureMember{member});
            add(CXDAddRecordToGroup, member, _address.guid);
        }
        for (const Value& removed : differences[kDeletions].array()) {
            const UniqueId member = identifierIn(removed);
            // Whoever leaves the all-contacts group has left the database.
            if (_isAllGroup) add(CXDDeleteRecord, member, {});
            add(CXDRemoveRecordFromGroup, member, _address.guid);
            add(CXDRemoveDistributionListFromGroup, member, _address.guid);
        }
    }

    void subgroups() {
        const Dictionary differences = differencesOf(kSubgroupUIDState);
        for (const Value& added : differences[kAdditions].array()) {
            const UniqueId subgroup = identifierIn(added);
            _steps.push_back(CaptureSubgroup{subgroup});
            add(CXDAddGroupToGroup, subgroup, _address.guid);
        }
        for (const Value& removed : differences[kDeletions].array()) {
            const UniqueId subgroup = identifierIn(removed);
            if (_isAllGroup) add(CXDDeleteGroup, {}, subgroup);
            add(CXDRemoveGroupFromGroup, subgroup, _address.guid);
        }
    }

    void name() {
        if (_isAllGroup) return; // every database names its own
        const Value now = Value(_current[kCXGroupNameProperty].string());
        // A group that came without a name was given one by the database and by nobody else. The real one may follow.
        if (_isKnown && !_prior.contains(kCXGroupNameProperty) && now == Value(defaultGroupName(RecordKind::group)))
            return;
        if (now != _prior[kCXGroupNameProperty]) add(CXDChangeGroupName, {}, _address.guid, now);
    }

    void accessLists() {
        if (_address.user != kSelf) return; // only the owner's own groups carry them
        accessList(CXDChangeGroupReadWriteACL, kCXReadWriteSharingACLProperty);
        accessList(CXDChangeGroupReadACL, kCXReadSharingACLProperty);
    }

    void distributionLists() {
        if (_isAllGroup) return;
        for (auto& record : compareDistributionStates(_prior[kDistributionListState].dictionary(),
                                                      _current[kDistributionListState].dictionary(), _address))
            _steps.push_back(std::move(record));
    }

    GroupSteps take() { return std::move(_steps); }

private:
    Dictionary differencesOf(const char* key) const {
        return cxDifferencesBetweenArray(_prior[key].array(), _current[key].array());
    }

    void accessList(CXDChangeType type, const char* property) {
        const Dictionary differences = differencesOf(property);
        if (!differences[kAdditions].array().empty() || !differences[kDeletions].array().empty())
            add(type, {}, _address.guid, differences);
    }

    void add(CXDChangeType type, const std::optional<UniqueId>& person, const std::optional<UniqueId>& group,
             const Value& payload = {}) {
        auto record = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, type, _address.user, person, group, payload);
        record->setAppliesToSources(_address.sources);
        _steps.push_back(std::move(record));
    }

    const bool _isKnown;
    const Dictionary _prior, _current;
    const GroupAddress& _address;
    const bool _isAllGroup;
    GroupSteps _steps;
};

// A group that is gone is withdrawn in the owner's name, wherever it was.
GroupSteps vanishedGroup(const GroupAddress& address) {
    auto record = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDDeleteGroup, kSelf, std::nullopt, address.guid);
    record->setAppliesToSources(address.sources);
    return {std::move(record)};
}

} // namespace

GroupSteps compareGroupStates(const Value& prior, const Value& current, const GroupAddress& address) {
    if (prior && !current) return vanishedGroup(address);
    Comparison comparison(prior, current, address);
    if (!prior && current) comparison.newGroup();
    comparison.members();
    comparison.subgroups();
    comparison.name();
    comparison.accessLists();
    comparison.distributionLists();
    return comparison.take();
}

CXDChangeRecords compareDistributionStates(const Dictionary& prior, const Dictionary& current,
                                           const GroupAddress& address) {
    CXDChangeRecords records;
    for (const auto& [person, choices] : current) {
        if (prior[person] == choices) continue;
        auto record = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDUpdateDistributionList, address.user,
                                                        UniqueId(person), address.guid, choices);
        record->setAppliesToSources(address.sources);
        records.push_back(std::move(record));
    }
    return records;
}

} // namespace rolvane
