#pragma once

#include "conduits/CXDConduit.h"
#include "conduits/ConduitEngine.h"
#include "model/RemoteLocationMap.h"

#include <algorithm>
#include <atomic>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

namespace rolvane::test {

// An engine that keeps the conduits' data in memory and writes down what it is asked for. The account's user is "ada"
// unless a test says otherwise.
class FakeEngine : public ConduitEngine {
public:
    UserName userForRemoteLocation(const RemoteLocation& location) const override {
        if (whenAskedForAUser) std::exchange(whenAskedForAUser, nullptr)();
        const auto user = rolvane::userForRemoteLocation(location, account, account.str());
        if (!user) note("kill " + location.str());
        return user.value_or(UserName());
    }

    Dictionary conduitObjectForKey(const std::string& conduitID, const std::string& key) override {
        return data.dictionaryFor(conduitID).dictionaryFor(key);
    }
    void setConduitObjectForKey(const std::string& conduitID, const Value& object, const std::string& key) override {
        data.dictionaryFor(conduitID).set(key, object);
    }
    void syncPrefs() override { note("syncPrefs"); }
    void saveInThePass() override {
        if (whenSaving) whenSaving();
    }

    bool isRevoked(const RemoteLocation& location) const override {
        return std::find(revoked.begin(), revoked.end(), location) != revoked.end();
    }
    std::vector<RemoteLocation> revokedRemoteLocations() const override { return revoked; }
    void revokeRemoteLocation(const RemoteLocation& location, const std::optional<UniqueId>& subscription) override {
        note("revoke " + location.str() + " " + (subscription ? subscription->str() : "-"));
        revoked.push_back(location);
    }
    void setRemoteLocationForSubscriptionUID(const std::optional<RemoteLocation>& location,
                                             const std::optional<UniqueId>& subscription) override {
        if (location && subscription) subscriptionMap[*subscription] = *location;
    }
    std::optional<RemoteLocation> remoteLocationForSubscriptionUID(const UniqueId& subscription) const override {
        const auto found = subscriptionMap.find(subscription);
        return found == subscriptionMap.end() ? std::nullopt : std::optional(found->second);
    }

    bool shouldChangeRecordBeCanceled(const CXDChangeRecord& record) const override {
        return canceledUser && record.user() == canceledUser;
    }
    void noteRefused(const Refusal& refusal) override { refused.push_back(refusal); }
    bool lockURL(const Url& url) override {
        note("lock " + url.absoluteString());
        return locks;
    }
    int32_t sourcesForGUID(const UniqueId& group) override {
        const auto found = sources.find(group);
        return found == sources.end() ? 0 : found->second;
    }
    CXDConduit* conduitForSyncSource(int32_t source) override {
        const auto found = conduits.find(source);
        return found == conduits.end() ? nullptr : found->second;
    }

    Dictionary knownGroupState(const std::string& conduitID, const UserName& user, const UniqueId& group) override {
        const std::lock_guard guard(_lock);
        return priorState(conduitID.c_str())[user.str()].dictionary()[group.str()].deepMutableCopy().dictionary();
    }
    void updateStateAndExitIfNeeded() override { note("updateStateAndExitIfNeeded"); }
    void checkCXShareCount() override { note("checkCXShareCount"); }
    void applyChangeRecords(const CXDChangeRecords& records) override {
        note("applyChangeRecords");
        applied = records;
    }
    void bringSourcesUpToDate() override { note("bringSourcesUpToDate"); }
    void cancel() override { note("cancel"); }

    mutable std::function<void()> whenAskedForAUser; // once
    std::function<void()> whenSaving;                // in the middle of a pass
    std::vector<Refusal> refused;

    std::vector<std::string> takeCalls() {
        const std::lock_guard guard(_lock);
        return std::exchange(_calls, {});
    }
    Dictionary priorState(const char* conduitID) { return conduitObjectForKey(conduitID, "priorState"); }

    UserName account{"ada"};
    Dictionary data;
    std::vector<RemoteLocation> revoked;
    std::map<UniqueId, RemoteLocation> subscriptionMap;
    std::optional<UserName> canceledUser;
    std::map<UniqueId, int32_t> sources;
    std::map<int32_t, CXDConduit*> conduits; // by source; none unless a test says so
    CXDChangeRecords applied;
    std::atomic<bool> locks = true;

private:
    void note(std::string call) const {
        const std::lock_guard guard(_lock);
        _calls.push_back(std::move(call));
    }
    mutable std::mutex _lock;
    mutable std::vector<std::string> _calls;
};

using Texts = std::vector<std::string>;

// A record in one line: "type user person group mask", with the payload behind it when it is a short one.
inline std::string line(const CXDChangeRecord& record) {
    const auto text = [](const auto& field) { return field ? field->str() : std::string("-"); };
    return std::to_string(record.type()) + " " + text(record.user()) + " " + text(record.person()) + " " +
           text(record.group()) + " " + std::to_string(record.appliesToSources());
}
inline Texts lines(const CXDChangeRecords& records) {
    Texts all;
    for (const auto& record : records) all.push_back(line(*record));
    return all;
}

} // namespace rolvane::test
