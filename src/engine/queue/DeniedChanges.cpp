#include "engine/queue/DeniedChanges.h"

#include "foundation/Mutex.h"

namespace rolvane {

void DeniedChanges::add(const CXDChangeRecordPtr& record) {
    const Lock guard(_lock);
    _records.insert(record);
}

void DeniedChanges::cancelLike(const CXDChangeRecordPtr& denied, const CXDChangeRecords& changes) {
    const Lock guard(_lock);
    _records.insert(denied);
    if (!denied->user()) return;
    for (const CXDChangeRecordPtr& change : changes)
        if (change->user() == denied->user()) _records.insert(change);
}

void DeniedChanges::noteRefused(const CXDChangeRecordPtr& record) {
    const Lock guard(_lock);
    _refused.push_back(record);
}

CXDChangeRecords DeniedChanges::refused() const {
    const Lock guard(_lock);
    return _refused;
}

bool DeniedChanges::contains(const CXDChangeRecord& record) const {
    const Lock guard(_lock);
    if (_records.empty()) return false;
    // A handle that owns nothing: the set is asked by the record's contents.
    const CXDChangeRecordPtr probe(const_cast<CXDChangeRecord*>(&record), [](CXDChangeRecord*) {});
    return _records.find(probe) != _records.end();
}

bool DeniedChanges::empty() const {
    const Lock guard(_lock);
    return _records.empty();
}

void DeniedChanges::clear() {
    const Lock guard(_lock);
    _records.clear();
    _refused.clear();
}

CXDChangeRecords DeniedChanges::all() const {
    const Lock guard(_lock);
    return CXDChangeRecords(_records.begin(), _records.end());
}

} // namespace rolvane
