#include "engine/recovery/Holdings.h"

#include "foundation/TestSwitch.h"

namespace rolvane {

Holdings::Holdings(CXRolvane& rolvane, const CXDChangeRecords& records, size_t fresh)
    : _rolvane(rolvane), _absences(rolvane) {
    if (isLeftOut("groups to come")) return;
    for (size_t i = fresh; i < records.size(); ++i)
        if (records[i]->type() == CXDCreateStructureForGroup && records[i]->group() &&
            records[i]->initialSource() == CXDSyncSourceVaultra)
            _toCome.insert(cxUIDWithTableName(*records[i]->group(), kCXGroupTable));
}

} // namespace rolvane
