#pragma once

#include "foundation/Value.h"
#include "server/PrivateStore.h"

#include <string>
#include <vector>

namespace rolvane {

inline constexpr const char* kStoreRealm = "Rolvane";

// httpd's configuration for a store: pure texts, nothing is read but the template.

// Where the template is: share/rolvane beside the program's directory, the source tree, or the install prefix.
// CXException when it is in none of them.
std::string storeTemplatePath();

// Where mod_davacl.so is: in httpd's directory of modules, lib/apache2/modules beside the program's directory, the
// build tree, or the install prefix. "" when it is in none of them.
std::string storeAccessModulePath(const std::string& httpdModules);

// The whole configuration. CXException when a path or line holds what a configuration file cannot carry.
std::string renderStoreConfiguration(const std::string& templateText, const PrivateStoreOptions& options, int port,
                                     bool withIPv6);

// The section that opens every user's own tree: to that user, or to everybody who is signed in where the access lists
// decide what that means.
std::string renderStoreUsers(const std::string& davDirectory, const std::vector<std::string>& users,
                             StoreAuthentication authentication, bool accessLists);

// The URL path where a user changes the own password (mod_davacl/PasswordChange.h); "" where the store lets nobody do
// that: with Digest, without access lists.
std::string storePasswordPath(const PrivateStoreOptions& options, const std::string& user);

// What store.plist keeps from one start to the next, and back. Unknown keys are left alone, missing ones take defaults.
Dictionary storeOptionsToDictionary(const PrivateStoreOptions& options, int port);
PrivateStoreOptions storeOptionsFromDictionary(const Dictionary& dictionary);

} // namespace rolvane
