#include "engine/EngineCollaborators.h"
#include "store/dav/CXDAVManager.h"

#include <utility>

namespace rolvane {

namespace {

class StoreNetworkAccount : public NetworkAccount {
public:
    std::optional<UserName> vaultraUser() const override {
        std::string user = CXDAVManager::vaultraUser();
        return user.empty() ? std::nullopt : std::optional(UserName(std::move(user)));
    }
    Value configValueForKey(const std::string& key, Value defaultValue) const override {
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
