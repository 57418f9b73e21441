#pragma once

#include "engine/queue/RecordIdentity.h"
#include "foundation/Mutex.h"
#include "model/CXDChangeRecord.h"

#include <unordered_set>

namespace rolvane {

// The records that a store refused in this pass, and those cancelled with them. Any thread; its lock is a leaf: nothing
// else is taken while it is held. Asking an empty set costs one atomic-sized read under the lock.
class DeniedChanges {
public:
    void add(const CXDChangeRecordPtr& record);
    // cancelPendingChangesLike:amongstChanges:: the record, and every record of the same user. Records without a user
    // are like no other. `changes` must not change meanwhile.
    void cancelLike(const CXDChangeRecordPtr& denied, const CXDChangeRecords& changes);
    // A record that the store itself has refused, and not one that is cancelled with it.
    void noteRefused(const CXDChangeRecordPtr& record);
    CXDChangeRecords refused() const;
    bool contains(const CXDChangeRecord& record) const; // by record equality
    bool empty() const;
    void clear();
    CXDChangeRecords all() const; // in no order; for the log

private:
    mutable Mutex _lock;
    std::unordered_set<CXDChangeRecordPtr, RecordHash, RecordEqual> _records GUARDED_BY(_lock);
    CXDChangeRecords _refused GUARDED_BY(_lock);
};

} // namespace rolvane
