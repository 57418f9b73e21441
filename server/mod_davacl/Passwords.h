#pragma once

#include "server/mod_davacl/Httpd.h"

#include <optional>
#include <string>

namespace rolvane::davacl {

// The provider "davacl" for AuthBasicProvider: users and their hashes are in the file that DavAclUserFile names, in any
// form that httpd reads. A slow hash is computed once for a user and not at every request; a line that has changed or
// is gone counts at the next request all the same.
void registerPasswords(apr_pool_t* pool);
// Makes the memory that the server's processes will share. A complaint, or null.
const char* preparePasswords(apr_pool_t* pool);
// The hash of the user's password at this moment: the user file's, or the one that the user has chosen. It differs when
// the password has been changed. Nothing where the file or the user's line is missing.
std::optional<std::string> hashInForce(const request_rec* r, const std::string& user);

} // namespace rolvane::davacl
