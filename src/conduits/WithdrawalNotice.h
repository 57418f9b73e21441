#pragma once

#include "contacts/database/WithdrawnContacts.h"

namespace rolvane {

class UserAlert;

// What a person learns of a subscription that has ended by the publisher's doing, and what stays of it. Main thread.
class WithdrawalNotice {
public:
    // All borrowed; they outlive the notice.
    WithdrawalNotice(WithdrawnContactsFolder& folder, const Clock& clock, UserAlert& alert)
        : _folder(folder), _clock(clock), _alert(alert) {}

    // Keeps the copies before they are removed. Nothing, after a line in the log, when they cannot be kept; then they
    // must stay.
    std::optional<WithdrawnContacts> keep(CXRolvane& database, const RemoteLocation& location, const UserName& user);
    // Once they are gone: tells the person whose they were, how many, and where they are now. Does not wait.
    void tell(const WithdrawnContacts& withdrawn);

private:
    WithdrawnContactsFolder& _folder;
    const Clock& _clock;
    UserAlert& _alert;
};

} // namespace rolvane
