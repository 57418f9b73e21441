#pragma once

#include "server/mod_davacl/Access.h"

#include <optional>
#include <string>

namespace rolvane::davacl {

// Principals are resources (RFC 3744 section 4): <principals>/users/<name> and <principals>/groups/<name>. They answer
// OPTIONS and PROPFIND. Nobody's list of all users is shown: a user is found by name.
int servePrincipals(request_rec* r) noexcept;

std::string userPath(const Configuration& c, const std::string& user);
std::string groupPath(const Configuration& c, const std::string& group);
// The content of DAV:principal in an entry.
std::string principalElement(request_rec* r, const Configuration& c, const Principal& principal);
std::string principalCollections(request_rec* r, const Configuration& c);
std::string currentUserPrincipal(request_rec* r, const Configuration& c);

// Whom a reference names; nothing when it names nobody whom this server knows.
std::optional<Principal> principalAt(request_rec* r, const Configuration& c, const std::string& href);
bool exists(request_rec* r, const Configuration& c, const Principal& principal);

} // namespace rolvane::davacl
