#include "conduits/store/NewOnStore.h"

#include "foundation/TestSwitch.h"

namespace rolvane {

void NewOnStore::beginPass() {
    const std::lock_guard guard(_lock);
    _named.clear();
    _waiting.clear();
}

void NewOnStore::listWaits(const std::vector<UniqueId>& records) {
    const std::lock_guard guard(_lock);
    _waiting.insert(records.begin(), records.end());
}

bool NewOnStore::waitsForList(const UniqueId& record) {
    const std::lock_guard guard(_lock);
    return _waiting.contains(record);
}

void NewOnStore::wasPut(const UserName& tree, const UniqueId& record, Date now) {
    {
        const std::lock_guard guard(_lock);
        if (!_named.erase(record)) {
            _put.insert(record);
            return;
        }
    }
    note({{record, tree, now}});
}

void NewOnStore::willName(const UserName& tree, const std::vector<UniqueId>& records, Date now) {
    std::vector<CXReached> reached;
    {
        const std::lock_guard guard(_lock);
        for (const UniqueId& record : records)
            if (_put.erase(record))
                reached.push_back({record, tree, now});
            else
                _named.insert(record);
    }
    note(reached);
}

void NewOnStore::note(const std::vector<CXReached>& reached) {
    if (!isLeftOut("reached")) _rolvane.noteReachedAtOnce(reached);
}

} // namespace rolvane
