#pragma once

#include "store/account/Account.h"

#include <string>

namespace rolvane {

// The password from its source, without the line end; "" for no source.
// CXException (kCXNetworkException) says what was tried and what to do.
//
// From then on the process leaves no core file, and no other program of the user looks into its memory
// (PR_SET_DUMPABLE, prctl(2)): the password and what is made of it stay there. A command gets the environment without
// what belongs to this process alone (LD_*, NOTIFY_SOCKET, LISTEN_*), without what shells obey (ENV, BASH_ENV,
// functions), and of PATH the absolute directories.
std::string readPassword(const PasswordSource& source);

} // namespace rolvane
