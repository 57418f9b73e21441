#pragma once

#include "engine/memory/StateRows.h"
#include "foundation/Mutex.h"
#include "foundation/Preferences.h"
#include "foundation/StrongString.h"
#include "foundation/Value.h"
#include "model/CXDChangeRecord.h"
#include "model/Refusal.h"

#include <functional>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

// Keys of the daemon's domain.
inline constexpr const char* kCXDPendingChanges = "CXDPendingChanges";
inline constexpr const char* kCXDConduitData = "CXDConduitData";
inline constexpr const char* kCXDStateEdition = "CXDStateEdition"; // another one with each change of the conduit data
inline constexpr const char* kCXDUnderWay = "CXDUnderWay";         // engine/recovery/UnderWay.h
inline constexpr const char* kCXDVaultraConduitLastSyncDate = "CXDVaultraConduitLastSyncDate";
inline constexpr const char* kCXDCXConduitLastSyncDate = "CXDCXConduitLastSyncDate";
inline constexpr const char* kCXDLocalConduitLastSyncDate = "CXDLocalConduitLastSyncDate";
inline constexpr const char* kCXDUnsavedAccessLists = "CXDUnsavedAccessLists"; // see CXDVaultraConduit
inline constexpr const char* kCXDShareCount = "CXDShareCount";
inline constexpr const char* kCXDLastOstrelUser = "CXDLastOstrelUser";
// What stores have refused, the latest last, for people to see: an array of dictionaries with these keys.
inline constexpr const char* kCXDRefusedChanges = "CXDRefusedChanges";
inline constexpr const char* kRefusedDate = "date";
inline constexpr const char* kRefusedUser = "user";       // whose contacts they were
inline constexpr const char* kRefusedChanges = "changes"; // how many
inline constexpr const char* kRefusedWhy = "why";         // as Refusal has them; missing when empty
inline constexpr const char* kRefusedGroup = "group";

// The engine's memory: the conduit data and the queue, in the daemon's domain of the preferences, which keep it in the
// contact database's own file (contacts/database/DaemonMemory.h). The conduit data is read on first
// need and lives in memory until it is dropped. Finding a conduit's dictionary is safe on any thread; the dictionaries
// that are found are shared and have no lock. Everything else on the main thread.
class EngineState {
public:
    explicit EngineState(Preferences& preferences) : _preferences(preferences) {}

    Dictionary conduitData();
    // The next use reads it again. What is in memory stays where it is just what is stored: reading takes as long as
    // there are people.
    void dropConduitData();
    // Another number whenever something of it was put that differs, but for the dates of trees, or read from elsewhere.
    uint64_t generation();
    void withConduitData(const std::function<void(Dictionary&)>& use);
    Dictionary conduitObjectForKey(const std::string& conduitID, const std::string& key); // made empty when absent
    void setConduitObjectForKey(const std::string& conduitID, const Value& object, const std::string& key);
    // Sets what has changed of it since it was read or put last, without synchronising.
    void putConduitData();
    // The same in the middle of a pass. `marks` (kUnsettledGroups, kUnsettledPeople) are those from before its scan;
    // they are stored beside the present ones, since the pass has not dealt with them yet.
    void putConduitDataWith(const Dictionary& marks);
    Dictionary marks();        // copies
    void forgetPut() noexcept; // what was put since the last synchronising was dropped: the next put sets it all anew
    void syncPrefs();          // putConduitData, then synchronise

    // A queue that cannot be read is empty.
    CXDChangeRecords getPendingChanges() const;
    void setPendingChanges(const CXDChangeRecords& records);

    // What a pass is about to put on the store: from before its first write, durably, to its very end.
    Dictionary underWay() const;
    void setUnderWay(const Dictionary& underWay); // without synchronising; empty: removes it

    // Adds what a pass was refused; the oldest are forgotten. Without synchronising.
    void noteRefusedChanges(const std::vector<Refusal>& refusals, Date when);
    // The one note of the owner's own changes that the owner's store refuses, as long as it does: how many they are,
    // and none when there are none. `when`: the date of a new refusal. Without synchronising.
    void noteRefusedByOwnStore(size_t changes, std::optional<Date> when);
    // What a pass meets on its way, for that note. Any thread; in memory only.
    void noteRefused(const Refusal& refusal);
    std::vector<Refusal> takeRefused();

    // Subscription identifier to remote location. Nothing happens when one of the two is missing.
    void setRemoteLocationForSubscriptionUID(const std::optional<RemoteLocation>& location,
                                             const std::optional<UniqueId>& subscription);
    std::optional<RemoteLocation> remoteLocationForSubscriptionUID(const UniqueId& subscription);
    void removeSubscriptionMapForRemoteLocation(const RemoteLocation& location); // every subscription to it
    void removeSubscription(const UniqueId& subscription);
    // Is what is remembered of the location known by other subscriptions only?
    bool isOfFormerSubscription(const RemoteLocation& location, const UniqueId& subscription);
    // What both conduits remember of the user, and the user's changes in the queue (durably). Nothing else is written.
    void forgetUser(const UserName& user);

    // What is remembered counts only together with the database's share count and the account's user: where they are
    // missing they are put down with it. Without synchronising.
    void claim(int64_t shareCount, const std::optional<UserName>& user);
    void reset(); // forgets everything, durably
    Preferences& preferences() const { return _preferences; }

private:
    Dictionary loadedConduitData() REQUIRES(_lock);
    bool isAsStored() REQUIRES(_lock);
    void put(const StateRows& rows) REQUIRES(_lock);

    Preferences& _preferences;
    Mutex _lock;
    std::optional<Dictionary> _conduitData GUARDED_BY(_lock);
    StateRows _stored GUARDED_BY(_lock);       // as the preferences have them, set or synchronised
    bool _putAll GUARDED_BY(_lock) = false;    // they may have others
    bool _isDropped GUARDED_BY(_lock) = false; // to be read again, unless nothing has changed
    Value _edition GUARDED_BY(_lock);          // of _stored
    uint64_t _generation GUARDED_BY(_lock) = 0;
    std::vector<Refusal> _refused GUARDED_BY(_lock);
};

} // namespace rolvane
