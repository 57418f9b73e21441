#include "LeftOnStore.h"

#include "Publication.h"
#include "Texts.h"

#include "conduits/PublishedLayout.h"
#include "contacts/records/Identifier.h"
#include "foundation/PropertyList.h"
#include "store/dav/CXDAVManager.h"
#include "store/locks/CXWebDAVLock.h"

#include <algorithm>
#include <fmt/format.h>
#include <set>

namespace rolvane::cli {

namespace {

constexpr const char* kLeftOnStore = "CXDLeftOnStore";
constexpr const char* kTree = "tree";
constexpr const char* kGroups = "groups";
constexpr int kMissing = 404;

} // namespace

std::string LeftOnStore::Failure::answer() const {
    return code == 0 ? translated("it did not answer") : tr("it answered {}", code);
}

LeftOnStore::LeftOnStore(CXRolvane& database, Preferences& preferences, const Url& base)
    : _database(database), _preferences(preferences), _base(base) {}

Dictionary LeftOnStore::note() const {
    Dictionary held =
        _preferences.get(kDaemonDomain, kLeftOnStore).dictionary()[_base.absoluteString()].dictionary().mutableCopy();
    const Publication publication(_database);
    if (publication.anything()) held.remove(kTree);
    Dictionary groups = held[kGroups].dictionary().mutableCopy();
    for (const std::string& group : groups.allKeys()) {
        const auto record = std::dynamic_pointer_cast<CXGroup>(_database.recordForUniqueId(UniqueId(group)));
        if (publication.everything() || (record && publication.publishes(record))) groups.remove(group);
    }
    held.set(kGroups, groups);
    return held;
}

void LeftOnStore::setNote(const Dictionary& note) {
    Dictionary all = _preferences.get(kDaemonDomain, kLeftOnStore).dictionary().mutableCopy();
    if (note.contains(kTree) || !note[kGroups].dictionary().empty())
        all.set(_base.absoluteString(), note);
    else
        all.remove(_base.absoluteString());
    _preferences.set(kDaemonDomain, kLeftOnStore, all.empty() ? Value() : Value(all));
    _preferences.synchronize(kDaemonDomain);
}

bool LeftOnStore::anything() const {
    const Dictionary held = note();
    return held.contains(kTree) || !held[kGroups].dictionary().empty();
}

bool LeftOnStore::isLeft(const UniqueId& group) const {
    const Dictionary held = note();
    return held.contains(kTree) || held[kGroups].dictionary().contains(group.str());
}

void LeftOnStore::noteTree() {
    setNote(Dictionary{{kTree, true}});
}

void LeftOnStore::noteGroup(const UniqueId& group, const std::vector<UniqueId>& people) {
    const Dictionary held = note();
    Array names;
    for (const UniqueId& person : people) names.append(person.str());
    held[kGroups].dictionary().set(group.str(), names);
    setNote(held);
}

void LeftOnStore::forgetTree() {
    setNote({});
}

void LeftOnStore::forgetGroup(const UniqueId& group) {
    Dictionary held = note();
    held[kGroups].dictionary().remove(group.str());
    setNote(held);
}

std::optional<LeftOnStore::Failure> LeftOnStore::remove() {
    const Dictionary held = note();
    if (held.contains(kTree)) {
        forgetPublication(_preferences);
        releaseLocksOfEndedRuns(CXDAVManager::defaultManager()); // they keep files on the store
        const auto failure = removeTree();
        if (!failure) setNote({});
        return failure;
    }
    const Dictionary groups = held[kGroups].dictionary();
    if (groups.empty()) return std::nullopt;
    releaseLocksOfEndedRuns(CXDAVManager::defaultManager());
    for (const std::string& group : groups.allKeys()) {
        forgetPublishedGroup(_preferences, UniqueId(group));
        if (auto failure = removeGroup(cxNormalizedUID(UniqueId(group)), groups[group].array())) return failure;
        forgetGroup(UniqueId(group));
    }
    return std::nullopt;
}

std::optional<LeftOnStore::Failure> LeftOnStore::removeTree() {
    int code = 0;
    if (CXDAVManager::defaultManager().removeFileAtURL(_base, &code)) return std::nullopt;
    return Failure{tr("the files at {}", _base.absoluteString()), code};
}

// Its mention in the list of groups, its state and directory, and the people of nobody else's interest.
std::optional<LeftOnStore::Failure> LeftOnStore::removeGroup(const UniqueId& group, const Array& people) {
    CXDAVManager& store = CXDAVManager::defaultManager();
    int code = 0;
    const Url all = layout::groupLocation(_base, UniqueId(layout::kAllGroup));
    const char* const list = translated("the group's entry in the list of groups");
    if (const auto state = store.dictionaryAtURL(all, true, &code)) {
        Dictionary changed = state->mutableCopy();
        Array subgroups = changed["subgroupUIDState"].array().mutableCopy();
        subgroups.removeAll(group.str());
        changed.set("subgroupUIDState", subgroups);
        if (!store.write(PropertyList::toXML(changed), all, true, &code)) return Failure{list, code};
    } else if (code != kMissing) {
        return Failure{list, code};
    }
    if (!store.removeFileAtURL(layout::groupLocation(_base, group), &code))
        return Failure{translated("the group"), code};
    std::set<UniqueId> wanted;
    for (const CXGroupRef& published : Publication(_database).groups())
        for (const UniqueId& member : published->memberIdentifiers()) wanted.insert(member);
    for (const Value& entry : people) {
        const UniqueId person(entry.string());
        if (!wanted.contains(person) && !store.removeFileAtURL(layout::contactLocation(_base, person), &code))
            return Failure{translated("a contact of the group"), code};
    }
    return std::nullopt;
}

bool anythingLeftOnStore(CXRolvane& database, Preferences& preferences) {
    const Dictionary all = preferences.get(kDaemonDomain, kLeftOnStore).dictionary();
    const auto bases = all.allKeys();
    return std::any_of(bases.begin(), bases.end(), [&](const std::string& base) {
        return LeftOnStore(database, preferences, Url(base)).anything();
    });
}

} // namespace rolvane::cli
