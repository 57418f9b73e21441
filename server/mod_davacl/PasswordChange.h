#pragma once

#include "server/mod_davacl/Httpd.h"

namespace rolvane::davacl {

// POST of "application/x-rolvane-password" to the own principal: the body is the user's new password, 8 to 72 bytes
// without control characters, and counts from the answer 204 on. A browser sends that type to no other site unasked.
// Only where DavAclOwnPasswords says where choices are kept, and to who has signed in for this request with the
// password in force (Basic, provider "davacl"); 409 to the second of two who change it at once.
int changePassword(request_rec* r);

// Notes for `changePassword` with which hash the request has signed in, and the administrator's hash of the user.
void noteHashes(request_rec* r, const char* given, const char* inForce);

} // namespace rolvane::davacl
