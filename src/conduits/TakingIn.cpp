#include "conduits/TakingIn.h"

#include "conduits/ConduitEngine.h"
#include "conduits/PublishedLayout.h"
#include "conduits/store/StoreComparison.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/records/Constants.h"
#include "model/Computers.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

#include <vector>

namespace rolvane {
namespace {

constexpr const char *kReads = "reads", *kScan = "scan";

std::string noteOf(ConduitEngine& engine) {
    return engine.conduitObjectForKey(kConduitCX, kTakingIn)[kSelf.str()].string();
}

void note(ConduitEngine& engine, const char* text) {
    Dictionary all = engine.conduitObjectForKey(kConduitCX, kTakingIn);
    text ? all.set(kSelf.str(), text) : all.remove(kSelf.str());
}

} // namespace

bool isTakingIn(ConduitEngine& engine, const Preferences& preferences, CXRolvane& database) {
    if (!isOneOfSeveral(preferences) || !database.allGroup()->valueForProperty(kCXRemoteLocationProperty)) return false;
    if (noteOf(engine) == kReads) return true;
    // The computer that has published the tree knows what was written there, before the tree was ever read.
    const Dictionary users = engine.conduitObjectForKey(kConduitVaultra, kPriorState);
    const Dictionary known = users[kSelf.str()].dictionary();
    return !known[kSerialNumber].isString() && known[std::string(layout::kAllGroup)].dictionary().empty();
}

// The database's access lists count as known: the store's take their place.
void beginTakingIn(ConduitEngine& engine, CXRolvane& database) {
    note(engine, kReads);
    engine.setConduitObjectForKey(kConduitCX, Dictionary(), kPublishAgain);
    Dictionary lists;
    for (const char* property : {kCXReadSharingACLProperty, kCXReadWriteSharingACLProperty})
        if (const auto listed = database.allGroup()->multiValueForProperty(property))
            lists.set(property, listed->_allValues());
    engine.conduitObjectForKey(kConduitCX, kPriorState)
        .set(kSelf.str(), Dictionary{{std::string(layout::kAllGroup), lists}});
    engine.conduitObjectForKey(kConduitVaultra, kPriorState).set(kSelf.str(), Dictionary{{kAllIsNew, true}});
    std::vector<UniqueId> reached;
    for (const CXReached& each : database.reached()) reached.push_back(each.uniqueId);
    if (!reached.empty()) database.forgetReached(reached);
}

void endTakingIn(ConduitEngine& engine) {
    note(engine, kScan);
}

void forgetTakingIn(ConduitEngine& engine) {
    note(engine, nullptr);
}

bool scansAfterTakingIn(ConduitEngine& engine) {
    if (noteOf(engine) != kScan) return false;
    note(engine, nullptr);
    return true;
}

} // namespace rolvane
