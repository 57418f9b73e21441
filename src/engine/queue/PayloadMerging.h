#pragma once

#include "foundation/Value.h"
#include "model/CXDChangeRecord.h"

namespace rolvane {

class CXMerger;

// The second payload's values folded into the first's as cards are merged. No database is touched.
Dictionary payloadMerging(CXMerger& merger, const Dictionary& first, const Dictionary& second);

// An older way to settle conflicts, which the pass does not use: the record swallows the records of other sources about
// the same person. The record that follows a swallowed one is not looked at.
CXDChangeRecordPtr mingleChangeAmongstChanges(CXMerger& merger, const CXDChangeRecordPtr& record,
                                              CXDChangeRecords& changes);

} // namespace rolvane
