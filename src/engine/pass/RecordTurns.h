#pragma once

#include "foundation/Mutex.h"
#include "model/CXDChangeRecord.h"

#include <functional>
#include <latch>
#include <memory>
#include <unordered_map>

namespace rolvane {

// Records of one pass that change the same thing (a user's group, or person) take turns in the order of the list: a
// change reads what the store holds, changes it and writes it back, and two of them side by side would leave the
// older one's result, or a refusal. Where others may write, a tree's contacts come before its list of everybody, and
// other groups and deletions behind it: whoever reads a name takes the record in, or misses it. All other records are
// free. Any thread after construction.
class RecordTurns {
public:
    // One hash a record; remembers those that have a neighbour. `inOrder`: may others write into this user's tree?
    explicit RecordTurns(const CXDChangeRecords& records, const std::function<bool(const UserName&)>& inOrder = {});

    // Waits until the record's predecessor has been done. Whoever takes records in the order of the list waits only for
    // one that somebody has taken before.
    void await(const CXDChangeRecord& record) const;
    bool waitsForList(const CXDChangeRecord& record) const; // whether `await` may wait for a list of everybody
    void done(const CXDChangeRecord& record);               // lets the next one go; once a record

private:
    struct Turn {
        std::shared_ptr<std::latch> before; // absent for the first
        std::shared_ptr<std::latch> own = std::make_shared<std::latch>(1);
    };
    // Of a tree whose list waits, and is waited for.
    struct Tree {
        Mutex lock;
        Condition changed;
        size_t contacts GUARDED_BY(lock) = 0, lists GUARDED_BY(lock) = 0; // that are not done yet
    };
    void order(const CXDChangeRecords& records, const std::function<bool(const UserName&)>& inOrder);
    Tree* treeOf(const CXDChangeRecord& record) const; // none where nothing waits
    std::unordered_map<const CXDChangeRecord*, Turn> _turns;
    std::unordered_map<UserName, std::unique_ptr<Tree>> _trees;
};

} // namespace rolvane
