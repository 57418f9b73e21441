#include "model/RemoteLocationMap.h"

#include "foundation/Url.h"
#include "model/CXDChangeRecord.h"

#include <algorithm>
#include <cctype>
#include <string_view>
#include <vector>

namespace rolvane {

namespace {

// Where the owner's name stands among the path components; the first component is the root.
constexpr size_t kStoreUserComponent = 1;
constexpr size_t kFolderUserComponent = 4;

bool equalIgnoringCase(std::string_view a, std::string_view b) {
    return std::equal(a.begin(), a.end(), b.begin(), b.end(),
                      [](unsigned char x, unsigned char y) { return std::tolower(x) == std::tolower(y); });
}

std::string componentAt(const RemoteLocation& location, size_t index) {
    const std::optional<Url> url = Url::parse(location.str());
    if (!url) return {};
    const std::vector<std::string> components = url->pathComponents();
    return index < components.size() ? components[index] : std::string();
}

} // namespace

std::optional<std::string> conduitIDForRemoteLocation(const RemoteLocation& location) {
    const std::string_view text = location.str();
    if (text.starts_with("http://")) return kConduitVaultra;
    if (text.starts_with("file:/")) return kConduitLocal;
    return std::nullopt;
}

int32_t syncSourceForRemoteLocation(const RemoteLocation& location) {
    const std::optional<std::string> conduit = conduitIDForRemoteLocation(location);
    if (!conduit) return 0;
    return *conduit == kConduitVaultra ? CXDSyncSourceVaultra : CXDSyncSourceLocal;
}

std::optional<UserName> userForRemoteLocation(const RemoteLocation& location,
                                              const std::optional<UserName>& accountUser,
                                              const std::string& loginName) {
    const std::optional<std::string> conduit = conduitIDForRemoteLocation(location);
    if (!conduit) return std::nullopt;
    if (*conduit == kConduitVaultra) {
        const std::string user = componentAt(location, kStoreUserComponent);
        // A path that is too short belongs to nobody, not even to an account without a name.
        const bool own = !user.empty() && accountUser && equalIgnoringCase(user, accountUser->str());
        return own ? kSelf : UserName(user);
    }
    const std::string user = componentAt(location, kFolderUserComponent);
    return !user.empty() && user == loginName ? kSelf : UserName(user);
}

} // namespace rolvane
