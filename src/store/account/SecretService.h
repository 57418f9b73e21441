#pragma once

#include <string>

namespace rolvane {

// The user's keyring on the session bus (Secret Service API, by libsecret). A password is an item with the attributes
// "program" = "rolvane" and "account" = `account`, which `secret-tool lookup program rolvane account ACCOUNT` finds,
// too.
//
// Any thread. Each call has a connection of its own that ends with it: a bus that goes away takes nothing with it.
// Waits are bounded. CXException (kCXNetworkException) says what happened and what to do.

// Nothing is asked of the person: a locked keyring is an error.
std::string secretFromService(const std::string& account);
// The person may be asked to unlock the keyring, or to make one. An item of that account is replaced.
void storeSecretInService(const std::string& account, const std::string& label, const std::string& secret);
// Nothing when there is none.
void removeSecretFromService(const std::string& account);
// Whether a keyring is there, and open. Nothing throws.
bool secretServiceIsOpen();

} // namespace rolvane
