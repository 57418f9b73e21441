#include "server/mod_davacl/Enforcement.h"

#include "server/mod_davacl/Access.h"
#include "server/mod_davacl/Locks.h"

#include <cstring>

namespace rolvane::davacl {
namespace {

// The lists themselves are never served, by whatever way a path leads to them.
bool isAmongTheLists(const request_rec* r, const Configuration& c) {
    const size_t length = std::strlen(c.lists);
    return r->filename && std::strncmp(r->filename, c.lists, length) == 0 &&
           (r->filename[length] == '/' || r->filename[length] == '\0');
}

// mod_dav looks a Destination up as a sub-request with the method of the request itself.
bool isDestination(const request_rec* r) {
    return r->main && std::strcmp(r->method, r->main->method) == 0 &&
           (std::strcmp(r->method, "COPY") == 0 || std::strcmp(r->method, "MOVE") == 0);
}

int check(request_rec* r) {
    const Configuration* c = configurationOf(r);
    if (!c) return DECLINED;
    if (isAmongTheLists(r, *c)) return HTTP_FORBIDDEN;
    const auto place = TreePath::of(c->base, r->uri);
    if (!place) return DECLINED;
    if (place->isReserved()) return HTTP_FORBIDDEN;
    const bool destination = isDestination(r);
    const Standing standing = standingOf(r);
    const auto missing =
        missingOf(r, *c, *place, destination ? needsOfDestination(r->method, standing) : needsOf(r->method, standing));
    if (!missing || (std::strcmp(r->method, "UNLOCK") == 0 && namesOwnLock(r))) return DECLINED;
    if (!r->main) return refuse(r, *c, *missing);
    if (destination) stateOf(r).destinationLacks = missing;
    return HTTP_FORBIDDEN;
}

} // namespace

int enforce(request_rec* r) noexcept {
    return contained(r, static_cast<int>(HTTP_INTERNAL_SERVER_ERROR), [r] { return check(r); });
}

int enforceOnMember(request_rec* r, dav_resource* source, const dav_resource* member, const apr_xml_doc*,
                    dav_error** error) noexcept {
    const bool readable = contained(r, false, [&] {
        const Configuration* c = configurationOf(r);
        if (!c || source || !member || !member->uri) return true;
        const auto place = TreePath::of(c->base, member->uri);
        return !place || (!place->isReserved() && (privilegesOn(r, *c, *place) & kRead));
    });
    if (readable) return DECLINED;
    *error = dav_new_error_tag(r->pool, HTTP_FORBIDDEN, 0, 0, "A member that may not be read is left out.",
                               "DAV:", "need-privileges");
    return DONE;
}

} // namespace rolvane::davacl
