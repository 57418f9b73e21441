#pragma once

#include "model/CXDChangeRecord.h"

#include <cstddef>
#include <memory>

namespace rolvane {

// Settles conflicts among the records of a pass: duplicates are dropped, and the owner's change wins over a
// subscriber's when one takes something away and the other does not. Of two changes by the owner the later one wins
// only where it undoes the earlier: the same member of the same group, or one takes out what the other changes. Records
// go in one by one, in order of arrival; the accepted ones come out in that order.
//
// Every identifier, a person's or a group's, has a bucket of the records accepted for it. A record is compared with its
// buckets' elements from the latest to the earliest. A long bucket is indexed by what can equal or contradict a
// record, so that a pass of C records costs O(C) expected, whatever the sizes of the groups.
// One pass, one thread, then discarded.
class Mingler {
public:
    // A bucket of `indexFrom` elements gets its index.
    explicit Mingler(size_t indexFrom = 16);
    ~Mingler();

    // mingleChange:from:intoBuckets:, and the record is appended to the mingled list when it is accepted. True then.
    // A record that a bucket accepts is accepted, even if its other bucket rejects it; one without identifiers is not.
    bool mingle(const CXDChangeRecordPtr& record);
    // Each in its turn. Faster for many: what a record will need is on its way to the processor while others are
    // handled.
    void mingle(const CXDChangeRecords& records);
    CXDChangeRecords takeMingled();
    // Its cost so far: how many elements of buckets were looked at.
    size_t elementsLookedAt() const;

private:
    class List;
    class Elements;
    class Index;
    struct Bucket;
    class Buckets;
    std::unique_ptr<Buckets> _buckets;
};

} // namespace rolvane
