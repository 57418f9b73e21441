#include "conduits/WithdrawalNotice.h"

#include "conduits/LocalizedText.h"
#include "conduits/UserAlert.h"
#include "foundation/CXException.h"
#include "foundation/Log.h"

namespace rolvane {
namespace {

const char* messageFor(const WithdrawnContacts& withdrawn) {
    if (withdrawn.file.empty()) return "SHARING_WITHDRAWN_EMPTY";
    return withdrawn.people == 1 ? "SHARING_WITHDRAWN_ONE" : "SHARING_WITHDRAWN";
}

} // namespace

std::optional<WithdrawnContacts> WithdrawalNotice::keep(CXRolvane& database, const RemoteLocation& location,
                                                        const UserName& user) {
    try {
        return _folder.keep(database, location, user, _clock.now());
    } catch (const CXException& e) {
        CXLog("The contacts of %@ are not shared with you any more. They cannot be kept, so they stay for now: %@",
              user, e.reason());
        return std::nullopt;
    }
}

void WithdrawalNotice::tell(const WithdrawnContacts& withdrawn) {
    UserAlert::Text text;
    text.header = localizedText("SHARING_WITHDRAWN_HEADER", {{"user", withdrawn.user.str()}});
    text.message = localizedText(
        messageFor(withdrawn),
        {{"user", withdrawn.user.str()}, {"count", std::to_string(withdrawn.people)}, {"file", withdrawn.file}});
    text.defaultButton = localizedText("OK");
    text.icon = "Rolvane";
    _alert.tell(text);
}

} // namespace rolvane
