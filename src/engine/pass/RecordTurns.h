#pragma once

#include "model/CXDChangeRecord.h"

#include <latch>
#include <memory>
#include <unordered_map>

namespace rolvane {

// Records of one pass that change the same thing (a user's group, or person) take turns in the order of the list: a
// change reads what the store holds, changes it and writes it back, and two of them side by side would leave the
// older one's result, or a refusal. All other records are free. Any thread after construction.
class RecordTurns {
public:
    // One hash a record; remembers those that have a neighbour.
    explicit RecordTurns(const CXDChangeRecords& records);

    // Waits until the record's predecessor has been done. Whoever takes records in the order of the list waits only for
    // one that somebody has taken before.
    void await(const CXDChangeRecord& record) const;
    void done(const CXDChangeRecord& record); // lets the next one go; once a record

private:
    struct Turn {
        std::shared_ptr<std::latch> before; // absent for the first
        std::shared_ptr<std::latch> own = std::make_shared<std::latch>(1);
    };
    std::unordered_map<const CXDChangeRecord*, Turn> _turns;
};

} // namespace rolvane
