#pragma once

#include "server/mod_davacl/Access.h"
#include "server/mod_davacl/ReportBody.h"

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane::davacl {

// Principals are resources (RFC 3744 section 4): <principals>/users/<name> and <principals>/groups/<name>. They answer
// OPTIONS, PROPFIND, REPORT and, with a small page, GET. Nobody's list of all users is shown: a user is found by name.
int servePrincipals(request_rec* r) noexcept;

std::string userPath(const Configuration& c, const std::string& user);
std::string groupPath(const Configuration& c, const std::string& group);
// The content of DAV:principal in an entry.
std::string principalElement(request_rec* r, const Configuration& c, const Principal& principal);
std::string principalCollections(request_rec* r, const Configuration& c);
std::string currentUserPrincipal(request_rec* r, const Configuration& c);

// Whom a reference names; nothing when it names nobody whom this server knows.
std::optional<Principal> principalAt(request_rec* r, const Configuration& c, const std::string& href);
// The user, and the groups that the user is in: whom a listing shows.
std::vector<Principal> ownPrincipals(request_rec* r, const Configuration& c);

std::string propstat(const std::string& properties, const char* status);
// What PROPFIND of the principal with Depth 0 tells, as a <D:response>; one with status 404 when there is none.
std::string principalResponse(request_rec* r, const Configuration& c, const Principal& principal,
                              const std::vector<Wanted>& wanted);
// The content of a property in DAV: of a principal who exists; nothing when it is not defined or not for this user.
std::optional<std::string> principalValue(request_rec* r, const Configuration& c, const Principal& principal,
                                          std::string_view name);
bool exists(request_rec* r, const Configuration& c, const Principal& principal);

} // namespace rolvane::davacl
