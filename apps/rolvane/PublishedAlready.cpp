#include "PublishedAlready.h"

#include "Computers.h"
#include "Texts.h"

#include "conduits/PublishedLayout.h"
#include "conduits/store/ComputersOnStore.h"
#include "conduits/store/StoreComparison.h"
#include "engine/memory/EngineState.h"
#include "engine/memory/StateRows.h"
#include "engine/pass/PassOutcome.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

#include <fmt/format.h>

namespace rolvane::cli {

namespace {

// The serial number that the daemon knows the account's own tree by; "" for none.
std::string knownSerial(const Preferences& preferences) {
    // The row that it would be stored in says where it stands.
    Dictionary tree, users, conduit, all;
    tree.set(kSerialNumber, std::string());
    users.set(kSelf.str(), tree);
    conduit.set(kPriorState, users);
    all.set(kConduitVaultra, conduit);
    for (const auto& [row, value] : stateRows(all))
        if (value.isString()) return preferences.get(kDaemonDomain, row).string();
    return {};
}

// The list of everybody has no entry, or is not there at all.
bool namesNobody(CXDAVManager& store, const Url& base) {
    int code = 0;
    const auto list = store.dictionaryAtURL(layout::groupLocation(base, UniqueId(layout::kAllGroup)), true, &code);
    constexpr int kMissing = 404;
    if (!list) return code == kMissing;
    return (*list)["memberUIDState"].array().empty() && (*list)["subgroupUIDState"].array().empty();
}

const char* name(PublishedAlready::By by) {
    switch (by) {
    case PublishedAlready::By::nobody: return "nobody";
    case PublishedAlready::By::thisComputer: return "thisComputer";
    case PublishedAlready::By::another: break;
    }
    return "another";
}

} // namespace

PublishedAlready publishedAlready(CXDAVManager& store, const Preferences& preferences, bool publishesHere) {
    const CXDAVAccount& account = store.account();
    const Url base = account.baseLocationFor(account.user);
    // In this order: the manager makes the own tree anew when its "info" is read and is not there.
    const bool isThere = store.sanityCheckPublishStructureCreate(false) ||
                         store.modDateForURL(base.cxURLByAppendingComponent(layout::kInfo));
    if (!isThere) return {};
    const auto info = store.dictionaryAtURL(base.cxURLByAppendingComponent(layout::kInfo), true, nullptr);
    if (!info) return {};
    const std::string serial = (*info)[kSerialNumber].string();
    const auto computers = ComputersOnStore(store, base).read().value_or(std::vector<Computer>());
    // A reader's own tree may be there with nothing in it.
    if (!publishesHere && computers.empty() && namesNobody(store, base)) return {};
    const std::string known = knownSerial(preferences);
    const bool isOurs = known.empty() ? publishesHere && lastOutcome(preferences) : serial == known;
    return {isOurs ? PublishedAlready::By::thisComputer : PublishedAlready::By::another,
            store.modDateForURL(base.cxURLByAppendingComponent(layout::kDateFile)), computers};
}

std::string publishedAlreadyText(const PublishedAlready& found) {
    const std::string when = found.lastWrite ? tr("; last written {}", shownDate(*found.lastWrite)) : "";
    switch (found.by) {
    case PublishedAlready::By::nobody: return translated("Nothing of this account is published yet.");
    case PublishedAlready::By::thisComputer:
        return tr("Contacts of this account are published, from this computer{}.", when);
    case PublishedAlready::By::another: break;
    }
    return tr("Contacts of this account are published already, from another computer or another database{}{}. "
              "`rolvane join` brings them here and keeps both in step.",
              found.computers.empty() ? "" : ": " + computersText(found.computers), when);
}

nlohmann::ordered_json publishedAlreadyJson(const PublishedAlready& found) {
    using Json = nlohmann::ordered_json;
    return {{"by", name(found.by)}, {"lastWrite", found.lastWrite ? Json(found.lastWrite->toISO8601()) : Json()}};
}

} // namespace rolvane::cli
