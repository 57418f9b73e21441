#pragma once

#include "store/account/Account.h"

#include <string>

namespace rolvane {

// The password from its source, without the line end; "" for no source.
// CXException (kCXNetworkException) says what was tried and what to do.
std::string readPassword(const PasswordSource& source);

} // namespace rolvane
