#pragma once

#include "store/account/Account.h"

#include <optional>
#include <string>

namespace rolvane::cli {

// The password that `rolvane setup` is trying, in a file of mode 0600 beside the account: what was made on the store
// and is not kept anywhere else yet is not lost with the process. Goes with this object unless it was told to stay.
class PendingPassword {
public:
    explicit PendingPassword(const CXDAVAccount& account); // the user and the endpoint that it is for
    ~PendingPassword();
    PendingPassword(const PendingPassword&) = delete;
    PendingPassword& operator=(const PendingPassword&) = delete;

    // The password that an earlier run has left for the same account.
    static std::optional<std::string> leftFor(const CXDAVAccount& account);

    void write(const std::string& password);
    PasswordSource source() const;
    void stay(bool stays) { _stays = stays; }
    void remove();

private:
    std::string _account;
    bool _stays = false;
};

} // namespace rolvane::cli
