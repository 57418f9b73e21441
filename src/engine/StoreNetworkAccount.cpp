#include "engine/EngineCollaborators.h"
#include "engine/pass/OutOfOrderWork.h"
#include "store/dav/CXDAVManager.h"
#include "store/http/StoreDistance.h"

#include <utility>

namespace rolvane {

namespace {

class StoreNetworkAccount : public NetworkAccount {
public:
    std::optional<UserName> vaultraUser() const override {
        std::string user = CXDAVManager::vaultraUser();
        return user.empty() ? std::nullopt : std::optional(UserName(std::move(user)));
    }
    // Behind a long way nobody waits for a worker that waits for the store, so that as many are used as there may be.
    Value configValueForKey(const std::string& key, Value defaultValue) const override {
        if (key == kThreadCountKey && isStoreFar(CXDAVManager::defaultManager())) defaultValue = kMostWorkers;
        return CXDAVManager::configValueForKey(key, std::move(defaultValue));
    }
    void updateConfigDataIfNeeded() override { CXDAVManager::updateConfigDataIfNeeded(); }
    void setFailedPasswordHandler(std::function<void()> handler) override {
        CXFileManager::setFailedPasswordHandler(std::move(handler));
    }
};

} // namespace

std::unique_ptr<NetworkAccount> makeStoreNetworkAccount() {
    return std::make_unique<StoreNetworkAccount>();
}

} // namespace rolvane
