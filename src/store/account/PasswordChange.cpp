#include "store/account/PasswordChange.h"

#include "foundation/CXException.h"

#include <memory>

namespace rolvane {

void changePasswordOnStore(CXDAVManager& store, const std::string& path, const std::string& password) {
    const auto fail = [](const std::string& why) {
        throw CXException(kCXNetworkException, "The store did not take a new password: " + why);
    };
    const std::vector<std::string> origins = store.account().origins();
    if (origins.empty() || path.empty() || path.front() != '/') fail("the account has no place for it.");
    CXDAVError error;
    if (!store.canReach(error)) fail(error.reason + "."); // signs in, too
    HttpRequest request;
    request.method = "POST";
    request.url = Url(origins.back() + path);
    request.headers = {{"Content-Type", "application/x-rolvane-password"}};
    request.body = std::make_shared<const std::string>(password);
    const HttpResponse answer = store.transport().perform(std::move(request));
    if (!answer.complete()) fail(answer.detail + ".");
    if (answer.status != 204) fail("it answered with " + std::to_string(answer.status) + ".");
}

} // namespace rolvane
