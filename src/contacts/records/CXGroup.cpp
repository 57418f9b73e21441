#include "contacts/records/CXGroup.h"

#include "contacts/database/RolvaneImpl.h"

#include <algorithm>
#include <set>

namespace rolvane {

namespace {

std::vector<UniqueId> sharing(std::vector<UniqueId> uids) {
    for (UniqueId& uid : uids) uid = cxNormalizedUID(uid);
    return uids;
}

// Groups still to be looked at on one way, each once.
struct Way {
    explicit Way(const UniqueId& from) : seen{from}, waiting{from} {}
    UniqueId take() {
        UniqueId next = std::move(waiting.back());
        waiting.pop_back();
        return next;
    }
    void add(std::vector<UniqueId> groups) {
        for (UniqueId& group : groups)
            if (seen.insert(group).second) waiting.push_back(std::move(group));
    }
    std::set<UniqueId> seen;
    std::vector<UniqueId> waiting;
};

// Is `wanted` the group or below it? Where that is a long way, it is looked for from both ends, so that the shorter one
// decides. Without recursion: groups come from other people, too, nested however deep.
bool holds(CXRolvane::Impl& d, const UniqueId& group, const UniqueId& wanted) {
    constexpr size_t kLong = 64;
    Way down(group), up(wanted);
    while (!down.waiting.empty() && !up.waiting.empty()) {
        const UniqueId below = down.take();
        if (below == wanted) return true;
        down.add(d.listed(below, true));
        if (down.seen.size() < kLong) continue;
        const UniqueId above = up.take();
        if (above == group) return true;
        up.add(d.parents(above));
    }
    return false;
}

CXSearchElement element(std::string_view table, std::string_view property, std::string_view label, std::string_view key,
                        Value value, int comparison) {
    return {std::string(table), std::string(property), std::string(label),
            std::string(key),   std::move(value),      static_cast<CXSearchComparison>(comparison)};
}

// The database that holds both, or an exception.
CXRolvane& databaseOfBoth(const CXGroup& group, const CXRecordRef& other) {
    CXRolvane* database = group.rolvane();
    if (!other) throw CXException(kCXInvalidArgumentException, "There is no record to list in " + group.name() + ".");
    if (!database || other->rolvane() != database || !group.isAttached() || !other->isAttached())
        throw CXException(kCXInvalidArgumentException, group.uniqueId().str() + " cannot list " +
                                                           other->uniqueId().str() +
                                                           ": both must have been added to the same database.");
    return *database;
}

} // namespace

CXGroupRef CXGroup::create() {
    return initWithUniqueId(makeUniqueId(kCXGroupTable));
}

CXGroupRef CXGroup::initWithUniqueId(const UniqueId& uid) {
    if (cxTableName(uid) == kCXSubscribedGroupTable) return CXSubscribedGroup::initWithUniqueId(uid);
    return CXGroupRef(new CXGroup(uid, Dictionary{{kCXGroupNameProperty, defaultGroupName(RecordKind::group)}}));
}

CXGroupRef CXSubscribedGroup::initWithUniqueId(const UniqueId& uid) {
    return CXGroupRef(
        new CXSubscribedGroup(uid, Dictionary{{kCXGroupNameProperty, defaultGroupName(RecordKind::subscribedGroup)}}));
}

CXSearchElement CXGroup::searchElementForProperty(std::string_view property, std::string_view label,
                                                  std::string_view key, Value value, int comparison) {
    return element(kCXGroupTable, property, label, key, std::move(value), comparison);
}

CXSearchElement CXSubscribedGroup::searchElementForProperty(std::string_view property, std::string_view label,
                                                            std::string_view key, Value value, int comparison) {
    return element(kCXSubscribedGroupTable, property, label, key, std::move(value), comparison);
}

std::string CXGroup::name() const {
    return valueForProperty(kCXGroupNameProperty).string();
}

std::vector<UniqueId> CXGroup::memberUniqueIds() const {
    CXRolvane* database = owner();
    if (!database) return {};
    std::lock_guard lock(database->impl().mutex);
    return database->impl().listed(uniqueId(), false);
}

std::vector<UniqueId> CXGroup::subgroupUniqueIds() const {
    CXRolvane* database = owner();
    if (!database) return {};
    std::lock_guard lock(database->impl().mutex);
    return database->impl().listed(uniqueId(), true);
}

std::vector<UniqueId> CXGroup::memberIdentifiersLike(const Array& known) const {
    return SharedForms(known).of(memberUniqueIds());
}
std::vector<UniqueId> CXGroup::subgroupIdentifiers() const {
    return sharing(subgroupUniqueIds());
}

size_t CXGroup::memberCount() const {
    CXRolvane* database = owner();
    if (!database) return 0;
    std::lock_guard lock(database->impl().mutex);
    if (!database->impl().work.empty()) return memberUniqueIds().size();
    return static_cast<size_t>(database->impl().store.countMembers(uniqueId()));
}

std::vector<CXPersonRef> CXGroup::members() const {
    CXRolvane* database = owner();
    if (!database) return {};
    std::lock_guard lock(database->impl().mutex);
    std::vector<CXPersonRef> people;
    for (const UniqueId& uid : memberUniqueIds())
        if (auto person = database->impl().handleAs<CXPerson>(uid)) people.push_back(person);
    return people;
}

std::vector<CXGroupRef> CXGroup::subgroups() const {
    CXRolvane* database = owner();
    if (!database) return {};
    std::lock_guard lock(database->impl().mutex);
    std::vector<CXGroupRef> groups;
    for (const UniqueId& uid : subgroupUniqueIds())
        if (auto group = database->impl().handleAs<CXGroup>(uid)) groups.push_back(group);
    return groups;
}

bool CXGroup::addMember(const CXPersonRef& person) {
    CXRolvane& database = databaseOfBoth(*this, person);
    std::lock_guard lock(database.impl().mutex);
    return database.impl().list(uniqueId(), person->uniqueId());
}

bool CXGroup::removeMember(const CXPersonRef& person) {
    CXRolvane& database = databaseOfBoth(*this, person);
    std::lock_guard lock(database.impl().mutex);
    return database.impl().unlist(uniqueId(), person->uniqueId());
}

bool CXGroup::addSubgroup(const CXGroupRef& group) {
    CXRolvane& database = databaseOfBoth(*this, group);
    std::lock_guard lock(database.impl().mutex);
    if (group->isAllGroup())
        throw CXException(kCXInvalidArgumentException, "An all-contacts group cannot be a subgroup of " + name() + ".");
    if (holds(database.impl(), group->uniqueId(), uniqueId()))
        throw CXException(kCXInvalidArgumentException, "The group \"" + group->name() +
                                                           "\" cannot become a subgroup of \"" + name() +
                                                           "\": it would contain itself.");
    return database.impl().list(uniqueId(), group->uniqueId());
}

bool CXGroup::mayListSubgroup(const CXGroupRef& group) const {
    CXRolvane* database = rolvane();
    if (!database || !group || group->rolvane() != database || group->isAllGroup()) return false;
    std::lock_guard lock(database->impl().mutex);
    return isAttached() && group->isAttached() && !holds(database->impl(), group->uniqueId(), uniqueId());
}

bool CXGroup::removeSubgroup(const CXGroupRef& group) {
    CXRolvane& database = databaseOfBoth(*this, group);
    std::lock_guard lock(database.impl().mutex);
    return database.impl().unlist(uniqueId(), group->uniqueId());
}

std::vector<CXGroupRef> CXGroup::parentGroups() const {
    CXRolvane* database = owner();
    if (!database) return {};
    std::lock_guard lock(database->impl().mutex);
    std::vector<CXGroupRef> groups;
    for (const UniqueId& uid : database->impl().parents(uniqueId()))
        if (auto group = database->impl().handleAs<CXGroup>(uid)) groups.push_back(group);
    return groups;
}

std::optional<std::string> CXGroup::distributionIdentifierForProperty(std::string_view property,
                                                                      const CXPersonRef& person) const {
    CXRolvane* database = owner();
    if (!database || !person) return std::nullopt;
    std::lock_guard lock(database->impl().mutex);
    return database->impl().choice(uniqueId(), person->uniqueId(), std::string(property));
}

void CXGroup::setDistributionIdentifier(const std::optional<std::string>& identifier, std::string_view property,
                                        const CXPersonRef& person) {
    CXRolvane& database = databaseOfBoth(*this, person);
    if (isAllGroup()) return;
    std::lock_guard lock(database.impl().mutex);
    database.impl().setChoice(uniqueId(), person->uniqueId(), std::string(property), identifier);
}

std::map<UniqueId, CXDistributionChoices> CXGroup::distributionChoices() const {
    CXRolvane* database = owner();
    if (!database || isAllGroup()) return {};
    std::lock_guard lock(database->impl().mutex);
    return database->impl().choicesOfGroup(uniqueId());
}

std::map<UniqueId, CXDistributionChoices> CXGroup::distributionChoicesForPerson(const CXPerson& person) {
    CXRolvane* database = person.rolvane();
    if (!database) return {};
    std::lock_guard lock(database->impl().mutex);
    return database->impl().choicesOfPerson(person.uniqueId());
}

CXSubscriptionRef CXGroup::subscription() const {
    CXRolvane* database = owner();
    RemoteLocation location = remoteLocation();
    if (!database || !isSubscribed() || location.empty()) return nullptr;
    return database->findSubscriptionWithRemoteLocation(location);
}

UniqueId CXGroupContents::nts_GroupUID() const {
    bool subscribed = cxTableName(uniqueId()) == kCXSubscribedGroupContentsTable;
    return cxUIDWithTableName(uniqueId(), subscribed ? kCXSubscribedGroupTable : kCXGroupTable);
}

} // namespace rolvane
