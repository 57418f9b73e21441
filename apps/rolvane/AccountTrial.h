#pragma once

#include "Context.h"

#include "store/account/Account.h"
#include "store/account/StoreTrial.h"

#include <string>
#include <vector>

namespace rolvane::cli {

// Refuses a source that gives no password, in the source's own words.
void requirePassword(const CXDAVAccount& account);

// The daemon reads the files from another directory than this one. Empty stays empty.
std::string absolutePath(const std::string& path);
// Has a running daemon take the account that was saved, and starts one that had ended because of the password.
void accountWasSaved(Context& context);

// Sentences for a usable store: each names an ability that it lacks, and the consequence.
std::vector<std::string> consequences(const StoreTrial& trial);
nlohmann::ordered_json trialJson(const StoreTrial& trial);

// Keeps the account's password and gives the source that has it from now on: a file of mode 0600 beside the account, or
// the user's keyring.
PasswordSource keptInFile(const std::string& password);
PasswordSource keptInKeyring(const CXDAVAccount& account, const std::string& password);
// "alice@https://dav.example.org": the name of the account's item in the keyring.
std::string keyringName(const CXDAVAccount& account);

} // namespace rolvane::cli
