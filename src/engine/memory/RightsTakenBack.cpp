#include "engine/memory/RightsTakenBack.h"

#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "engine/memory/EngineState.h"
#include "engine/memory/PriorStates.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

namespace rolvane {

void forgetRightTakenBack(Preferences& preferences, const std::string& user, bool reading) {
    if (!preferences.get(kDaemonDomain, kCXDUnsavedAccessLists).dictionary().empty()) return;
    EngineState state(preferences);
    state.withConduitData([&](Dictionary& data) {
        for (const CXDChangeType list : {CXDChangeGroupReadWriteACL, CXDChangeGroupReadACL}) {
            if (list == CXDChangeGroupReadACL && !reading) continue;
            updateCache(data, CXDSyncSourceCX,
                        CXDChangeRecord(CXDSyncSourceCX, list, kSelf, std::nullopt,
                                        UniqueId(std::string(kCXAllGroupUID)), Dictionary{{kDeletions, Array{user}}}));
        }
    });
    state.syncPrefs();
}

} // namespace rolvane
