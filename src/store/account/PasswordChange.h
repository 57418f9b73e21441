#pragma once

#include "store/dav/CXDAVManager.h"

#include <string>

namespace rolvane {

// Gives the account's user another password on its store, at the URL path that the store has for it
// (server/mod_davacl/PasswordChange.h). It counts when this returns; the manager goes on with the former one and is of
// no more use. The path is asked of the endpoint's origin alone, over TLS or on this machine.
//
// CXException (kCXNetworkException) says why not. Then the former password counts; or, after a lost answer, either.
void changePasswordOnStore(CXDAVManager& store, const std::string& path, const std::string& password);

} // namespace rolvane
