#pragma once

#include "CaptureWorld.h"
#include "TestRecord.h"
#include "store/files/CXFileManager.h"

namespace rolvane::test {

// A store's file manager that answers with what it was given and counts what was asked.
class CannedFiles : public CXFileManager {
public:
    std::optional<Dictionary> dictionaryAtURL(const Url& url, int* errorCode, bool) override {
        ++reads;
        const auto found = files.find(url.absoluteString());
        if (errorCode) *errorCode = found == files.end() ? 404 : 200;
        return found == files.end() ? std::nullopt : std::optional(found->second);
    }
    std::map<std::string, Dictionary> files;
    int reads = 0;
};

// The network store as far as access-list changes ask for it.
class StandInStore : public CXDConduit {
public:
    using CXDConduit::CXDConduit;
    std::optional<Url> baseLocationForUser(const std::optional<UserName>& user) const override {
        if (!user) return std::nullopt;
        return Url("http://store.example/" + user->str() + "/Contacts");
    }
};

// The world of CaptureWorld with a subscription to Bob's list and records that come from the store. Carol may write the
// owner's own data, so the kill switch is off unless a test turns it on.
class ApplyWorld : public CaptureWorld {
public:
    ApplyWorld() {
        subscribe();
        database.allGroup()->setValue(principals({"carol"}), kCXReadWriteSharingACLProperty);
        save();
        conduit = makeConduit();
        engine.conduits[CXDSyncSourceVaultra] = &store;
    }

    static CXDChangeRecordPtr record(int type, const char* user, const char* person, const char* group,
                                     Value payload = {}) {
        auto made = testRecord(CXDSyncSourceVaultra, type, person, group, std::move(payload), user);
        made->setAppliesToSources(CXDSyncSourceCX);
        return made;
    }
    bool apply(int type, const char* user, const char* person, const char* group, Value payload = {}) {
        bool denied = false;
        const bool done = conduit->applyChangeRecord(record(type, user, person, group, std::move(payload)), &denied);
        EXPECT_FALSE(denied) << "the contact database never denies";
        return done;
    }
    static Dictionary card(const char* name, const RemoteLocation& from = kBobsLocation) {
        return {{kCXFirstNameProperty, name},
                {kCXRemoteLocationProperty, oneLocation(from, kCXSubscribeLabel).toValue()}};
    }
    static Dictionary groupPayload(const char* name, const RemoteLocation& from = kBobsLocation) {
        return {{kCXGroupNameProperty, name},
                {kCXRemoteLocationProperty, oneLocation(from, kCXSubscribeLabel).toValue()}};
    }
    CXPersonRef personAt(const char* uid) {
        return std::dynamic_pointer_cast<CXPerson>(database.recordForUniqueId(UniqueId(uid)));
    }
    CXGroupRef groupAt(const char* uid) {
        return std::dynamic_pointer_cast<CXGroup>(database.recordForUniqueId(UniqueId(uid)));
    }
    std::string nameOf(const char* uid) {
        const auto found = database.recordForUniqueId(UniqueId(uid));
        if (!found) return "(gone)";
        return found->valueForProperty(isGroupUID(uid) ? kCXGroupNameProperty : kCXFirstNameProperty).string();
    }
    static bool isGroupUID(const std::string& uid) { return uid.ends_with("Group"); }
    // "kind uid name location; members; subgroups; choices" of everything, for comparing what was with what is.
    Texts contents() {
        Texts all;
        for (const char* table : {"CXPerson", "CXSubscribedPerson"})
            database.forEachPersonModifiedSince(Date::distantPast(), table, [&](const CXRow& row) {
                all.push_back(row.uniqueId.str() + " " + Value(BinaryValueOf(row)).description());
            });
        for (const auto& listing : database.listGroups(std::nullopt)) {
            const auto group = groupAt(listing.uniqueId.str().c_str());
            std::string text = listing.uniqueId.str() + " " + Value(group->dictionaryRepresentation()).description();
            for (const auto& member : group->memberUniqueIds()) text += " +" + member.str();
            for (const auto& subgroup : group->subgroupUniqueIds()) text += " >" + subgroup.str();
            for (const auto& [person, choices] : group->distributionChoices())
                for (const auto& [property, identifier] : choices)
                    text += " " + person.str() + "." + property + "=" + identifier;
            all.push_back(text);
        }
        all.push_back(Value(database.allGroup()->dictionaryRepresentation()).description());
        for (const auto& subscription : database.subscriptions()) all.push_back(subscription->description());
        std::sort(all.begin(), all.end());
        return all;
    }

    CannedFiles files;
    StandInStore store{engine};

private:
    Dictionary BinaryValueOf(const CXRow& row) {
        return personAt(row.uniqueId.str().c_str())->dictionaryRepresentation();
    }
};

} // namespace rolvane::test
