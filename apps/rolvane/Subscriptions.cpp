#include "Subscriptions.h"

#include "Context.h"
#include "Publication.h"
#include "Texts.h"
#include "ValueNames.h"

#include "conduits/PublishedLayout.h"
#include "contacts/records/Identifier.h"
#include "engine/memory/EngineState.h"
#include "model/RemoteLocationMap.h"
#include "store/dav/CXDAVManager.h"

#include <algorithm>
#include <fmt/format.h>
#include <set>

namespace rolvane::cli {

namespace {

constexpr const char* kPriorState = "priorState";

std::string folded(std::string text) {
    for (char& c : text)
        if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
    return text;
}

} // namespace

std::string publisherOf(const RemoteLocation& location) {
    const auto user = userForRemoteLocation(location, std::nullopt, {});
    return user ? user->str() : std::string();
}

RemoteLocation namedLocation(const std::string& named) {
    const auto baseOf = [](const std::string& user) {
        return RemoteLocation(CXDAVManager::ostrelBaseLocationForOstrelUser(UserName(user)).absoluteString());
    };
    if (named.empty()) throw CommandError(kUsage, translated("Name the user whose contacts you want."));
    const bool isLocation = named.find(':') != std::string::npos || named.find('/') != std::string::npos;
    if (!isLocation) return baseOf(named);
    std::string text = named;
    while (text.ends_with('/')) text.pop_back();
    const RemoteLocation location(text);
    if (syncSourceForRemoteLocation(location) != CXDSyncSourceVaultra)
        throw CommandError(kUsage, tr("\"{}\" is no location of a store. Give the user's name, or a location "
                                      "like {}.",
                                      named, baseOf("alice").str()));
    const std::string user = publisherOf(location);
    if (user.empty() || baseOf(user) != location)
        throw CommandError(kNotFound, tr("{} is not on the store of your account, where locations are like "
                                         "{}. Give the user's name instead.",
                                         named, baseOf(user.empty() ? "alice" : user).str()));
    return location;
}

bool mayBeRead(const RemoteLocation& location) {
    int code = 0;
    const Url info = Url(location.str()).cxURLByAppendingComponent(layout::kInfo);
    return CXDAVManager::defaultManager().dictionaryAtURL(info, false, &code).has_value();
}

std::string ownerMark(const CXListing& listing) {
    return listing.location.empty() ? "" : "  [" + publisherOf(listing.location) + "]";
}

std::vector<CXSubscriptionRef> subscriptionsToPeople(CXRolvane& database) {
    std::vector<CXSubscriptionRef> all = database.subscriptions();
    std::erase_if(all, [](const CXSubscriptionRef& s) {
        return s->isLocal() || s->remoteLocation() == RemoteLocation(Publication::kGroupsLocation);
    });
    return all;
}

CXSubscriptionRef findSubscription(CXRolvane& database, const std::string& named) {
    const std::vector<CXSubscriptionRef> all = subscriptionsToPeople(database);
    std::vector<CXSubscriptionRef> found;
    for (const CXSubscriptionRef& s : all)
        if (s->remoteLocation().str() == named) return s;
    for (const CXSubscriptionRef& s : all)
        if (publisherOf(s->remoteLocation()) == named) found.push_back(s);
    if (found.empty())
        for (const CXSubscriptionRef& s : all)
            if (folded(publisherOf(s->remoteLocation())) == folded(named)) found.push_back(s);
    if (found.size() == 1) return found.front();
    if (found.empty())
        throw CommandError(kNotFound, tr("There is no subscription to \"{}\". `rolvane subscriptions` lists "
                                         "what there is.",
                                         named));
    std::string list;
    for (const CXSubscriptionRef& s : found) list += "\n  " + s->remoteLocation().str();
    throw CommandError(kNotFound,
                       tr("\"{}\" fits {} subscriptions. Name one by its location:{}", named, found.size(), list));
}

void declareWhose(CLI::App& command, Whose& whose) {
    CLI::Option* of = command.add_option("--of", whose.publisher, "Only what came from this user (or location)")
                          ->type_name(kPublisherValue);
    command.add_flag("--own", whose.own, "Only your own")->excludes(of);
}

std::optional<RemoteLocation> locationOf(CXRolvane& database, const Whose& whose) {
    if (whose.own) return RemoteLocation("");
    if (whose.publisher.empty()) return std::nullopt;
    return findSubscription(database, whose.publisher)->remoteLocation();
}

bool wasRead(Preferences& preferences, const RemoteLocation& location) {
    EngineState state(preferences);
    return state.conduitObjectForKey(kConduitVaultra, kPriorState).contains(publisherOf(location));
}

size_t pendingFor(Preferences& preferences, const RemoteLocation& location) {
    const UserName user(publisherOf(location));
    const CXDChangeRecords waiting = EngineState(preferences).getPendingChanges();
    return static_cast<size_t>(std::count_if(waiting.begin(), waiting.end(), [&](const CXDChangeRecordPtr& record) {
        return record->user() == user && (record->appliesToSources() & CXDSyncSourceVaultra) != 0;
    }));
}

size_t unsentTo(CXRolvane& database, Preferences& preferences, const RemoteLocation& location) {
    const UserName user(publisherOf(location));
    std::set<UniqueId> waiting;
    for (const CXDChangeRecordPtr& record : EngineState(preferences).getPendingChanges())
        if (record->user() == user && record->person()) waiting.insert(*record->person());
    size_t unsent = pendingFor(preferences, location);
    for (const UniqueId& uid : database.editedSinceCommon())
        if (const auto row = database.personRow(uid);
            row && row->location == location && !waiting.contains(cxNormalizedUID(row->sharingUniqueId)))
            unsent++;
    return unsent;
}

void forgetSubscription(Preferences& preferences, const RemoteLocation& location, const UniqueId& subscription) {
    EngineState state(preferences);
    state.forgetUser(UserName(publisherOf(location)));
    state.removeSubscription(subscription);
    state.syncPrefs();
}

} // namespace rolvane::cli
