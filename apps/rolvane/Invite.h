#pragma once

#include "Context.h"

#include "store/account/Invitation.h"

#include <string>

namespace rolvane::cli {

// The line on standard output, and what it is good for on standard error.
void printInvitation(Context& context, const Invitation& invitation, bool qr);
// The same for a further computer of the account's own user: the line holds the account's password.
void inviteOwnComputer(Context& context, bool qr);
// This database's own user where the account is on that store; "" elsewhere.
std::string inviterOn(const std::string& endpoint);

} // namespace rolvane::cli
