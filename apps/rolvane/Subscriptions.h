#pragma once

#include "contacts/database/CXRolvane.h"
#include "foundation/Preferences.h"

#include <CLI/CLI.hpp>
#include <optional>
#include <string>
#include <vector>

namespace rolvane::cli {

// What came from other people, in the contact database.

// The name of the user who publishes at the location; "" for "", the owner's own.
std::string publisherOf(const RemoteLocation& location);

// The location that a user's name or a location names on the account's store, as the daemon asks for it. Throws
// CommandError when it can be none.
RemoteLocation namedLocation(const std::string& named);
// Does the store let the account read what is published there?
bool mayBeRead(const RemoteLocation& location);

// "  [bob]" behind a record of bob's in a list, "" behind the owner's own.
std::string ownerMark(const CXListing& listing);

// The subscriptions to other people's data, oldest first; the database's own entries are left out.
std::vector<CXSubscriptionRef> subscriptionsToPeople(CXRolvane& database);

// The one that a person means: by location, or by the publisher's name (letter case does not matter). Throws
// CommandError kNotFound.
CXSubscriptionRef findSubscription(CXRolvane& database, const std::string& named);

// Whose records a listing is to show: everybody's, the owner's own, or one publisher's.
struct Whose {
    bool own = false;
    std::string publisher; // a user or a location; "" for everybody
};
void declareWhose(CLI::App& command, Whose& whose); // --of and --own
// Nothing for everybody's; empty for the owner's own. Throws as findSubscription.
std::optional<RemoteLocation> locationOf(CXRolvane& database, const Whose& whose);

// What the daemon remembers of a subscription, in its preferences.
// Whether a pass has read what is published there.
bool wasRead(Preferences& preferences, const RemoteLocation& location);
// Changes that wait to be sent to that publisher.
size_t pendingFor(Preferences& preferences, const RemoteLocation& location);
// The same with edits of that publisher's people that no pass has met yet.
size_t unsentTo(CXRolvane& database, Preferences& preferences, const RemoteLocation& location);
// Forgets the publisher's data and the changes that wait for it. Only while no daemon runs.
void forgetSubscription(Preferences& preferences, const RemoteLocation& location, const UniqueId& subscription);

} // namespace rolvane::cli
