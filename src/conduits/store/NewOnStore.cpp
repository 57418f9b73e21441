#include "conduits/store/NewOnStore.h"

#include "contacts/records/Constants.h"
#include "foundation/Mutex.h"
#include "foundation/TestSwitch.h"

namespace rolvane {
namespace {

bool isContact(const UniqueId& record) {
    return record.endsWith(kCXPersonTable) || record.endsWith(kCXSubscribedPersonTable);
}

} // namespace

void NewOnStore::beginPass(const std::unordered_set<UniqueId>& newRecords) {
    const std::vector<CXReached> noted = _rolvane.reached();
    const Lock guard(_lock);
    _newRecords = &newRecords;
    _named.clear();
    _waiting.clear();
    _alone.clear();
    for (const CXReached& each : noted)
        if (!each.hasFile) _alone.insert(each.uniqueId);
}

void NewOnStore::listWaits(const std::vector<UniqueId>& records) {
    const Lock guard(_lock);
    _waiting.insert(records.begin(), records.end());
}

bool NewOnStore::waitsForList(const UniqueId& record) {
    const Lock guard(_lock);
    return _waiting.contains(record);
}

void NewOnStore::wasPut(const UserName& tree, const UniqueId& record, Date now) {
    {
        const Lock guard(_lock);
        const bool wasAlone = _alone.erase(record) > 0;
        if (!_named.erase(record) && !wasAlone) {
            _put.insert(record);
            return;
        }
    }
    note({{record, tree, now}});
}

void NewOnStore::willName(const UserName& tree, const std::vector<UniqueId>& records, Date now) {
    std::vector<CXReached> reached;
    {
        const Lock guard(_lock);
        for (const UniqueId& record : records)
            if (_put.erase(record)) {
                reached.push_back({record, tree, now});
            } else {
                _named.insert(record);
                const bool isToCome = isContact(record) && _newRecords && _newRecords->contains(record);
                if (isToCome && !isLeftOut("named alone") && _alone.insert(record).second)
                    reached.push_back({record, tree, now, false});
            }
    }
    note(reached);
}

bool NewOnStore::isNamedAlone(const UniqueId& contact) {
    const Lock guard(_lock);
    return _alone.contains(contact);
}

void NewOnStore::note(const std::vector<CXReached>& reached) {
    if (!isLeftOut("reached")) _rolvane.noteReachedAtOnce(reached);
}

} // namespace rolvane
