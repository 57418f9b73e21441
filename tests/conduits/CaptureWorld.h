#pragma once

#include "DaemonDatabase.h"
#include "FakeEngine.h"
#include "conduits/database/CXDCXConduit.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/database/DaemonMemory.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "foundation/Preferences.h"
#include "support/TempHome.h"

#include <gtest/gtest.h>
#include <initializer_list>
#include <memory>
#include <string>

namespace rolvane::test {

inline const RemoteLocation kOwnLocation("http://store.example/ada/Contacts");
inline const RemoteLocation kBobsLocation("http://store.example/bob/Contacts");

inline CXMultiValue oneLocation(const RemoteLocation& location, const char* label) {
    CXMutableMultiValue locations;
    locations.addValue(location, label);
    return locations;
}

inline CXMultiValue principals(std::initializer_list<const char*> names) {
    CXMutableMultiValue all;
    for (const char* name : names) all.addValue(name, name);
    return all;
}

// A contact database in a directory of its own, the conduit over it, and the engine that it talks to. The clock stands
// until a test moves it; every save moves it by a second, so that dates tell saves apart.
class CaptureWorld : public testing::Test {
public:
    CaptureWorld() {
        engine.whenSaving = [this] { database.save(); };
        conduit = makeConduit();
    }

    std::unique_ptr<CXDCXConduit> makeConduit() {
        // Saves of this very process count as another's, because the tests are both sides.
        return std::make_unique<CXDCXConduit>(engine, CXDCXConduit::Collaborators{database, preferences, clock, center,
                                                                                  /*processID*/ 1, "another program"});
    }

    CXPersonRef person(const char* name, const char* uuid = nullptr) {
        auto made = uuid ? CXPerson::initWithUniqueId(UniqueId(std::string(uuid) + ":CXPerson")) : CXPerson::create();
        made->setValue(Value(name), kCXFirstNameProperty);
        database.addRecord(made);
        return made;
    }
    CXPersonRef subscribedPerson(const char* name, const char* uuid, const RemoteLocation& from = kBobsLocation) {
        auto made = CXSubscribedPerson::initWithUniqueId(UniqueId(std::string(uuid) + ":CXSubscribedPerson"));
        made->setValue(Value(name), kCXFirstNameProperty);
        made->setValue(oneLocation(from, kCXSubscribeLabel), kCXRemoteLocationProperty);
        database.addRecord(made);
        return made;
    }
    CXGroupRef group(const char* name, std::initializer_list<CXPersonRef> members = {}, const char* uuid = nullptr) {
        auto made = uuid ? CXGroup::initWithUniqueId(UniqueId(std::string(uuid) + ":CXGroup")) : CXGroup::create();
        made->setValue(Value(name), kCXGroupNameProperty);
        database.addRecord(made);
        for (const auto& member : members) made->addMember(member);
        return made;
    }
    CXGroupRef subscribedGroup(const char* name, const char* uuid, const RemoteLocation& from = kBobsLocation) {
        auto made = CXSubscribedGroup::initWithUniqueId(UniqueId(std::string(uuid) + ":CXSubscribedGroup"));
        made->setValue(Value(name), kCXGroupNameProperty);
        made->setValue(oneLocation(from, kCXSubscribeLabel), kCXRemoteLocationProperty);
        database.addRecord(made);
        return made;
    }
    void publishAll() {
        database.allGroup()->setValue(oneLocation(kOwnLocation, kCXPublishLabel), kCXRemoteLocationProperty);
    }
    CXSubscriptionRef subscribe(const RemoteLocation& location = kBobsLocation) {
        auto subscription = CXSubscription::create(location);
        database.addRecord(subscription);
        return subscription;
    }
    void save() {
        clock.advance(1);
        database.save();
        clock.advance(1);
    }
    // What the engine does once a group has been carried to its location.
    void knows(const UserName& user, const CXGroupRef& group) {
        const Dictionary state = stateOf(group);
        engine.priorState("CXDCX")
            .dictionaryFor(user.str())
            .set(cxUIDWithTableName(group->sharingUniqueId(), "CXGroup").str(), state);
    }
    Dictionary stateOf(const CXGroupRef& group) {
        Array members, subgroups;
        for (const auto& member : group->memberIdentifiers()) members.append(cxNormalizedUID(member));
        for (const auto& subgroup : group->subgroupIdentifiers()) subgroups.append(cxNormalizedUID(subgroup));
        return {{"memberUIDState", members},
                {"subgroupUIDState", subgroups},
                {kCXGroupNameProperty, group->name()},
                {"distributionListState", conduit->currentDistributionListStateForGroup(group)}};
    }

    Notification changed(std::initializer_list<UniqueId> inserted, std::initializer_list<UniqueId> updated,
                         std::initializer_list<UniqueId> deleted, int64_t sender = 4711) {
        Notification notification;
        notification.name = kCXDatabaseChangedExternallyNotificationPriv;
        const auto put = [&](const char* key, std::initializer_list<UniqueId> uids) {
            if (uids.size() == 0) return; // absent, as the framework may leave it
            Array all;
            for (const auto& uid : uids) all.append(uid);
            notification.userInfo.set(key, all);
        };
        put(kCXInsertedRecords, inserted);
        put(kCXUpdatedRecords, updated);
        put(kCXDeletedRecords, deleted);
        notification.userInfo.set(kCXSenderProcessID, sender);
        return notification;
    }
    // What the engine is handed after the notification.
    CXDChangeRecords after(const Notification& notification) {
        engine.applied.clear();
        center.post(notification);
        return engine.applied;
    }

    TempDirectory directory;
    ManualClock clock{Date(1'800'000'000)};
    NotificationCenter center;
    Preferences preferences{directory / "preferences.db", daemonMemory(directory / "contacts.db")};
    CXRolvane database{daemonDatabase(directory, clock, center)};
    FakeEngine engine;
    std::unique_ptr<CXDCXConduit> conduit;
};

} // namespace rolvane::test
