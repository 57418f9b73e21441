#include "server/mod_davacl/Enforcement.h"

#include "server/mod_davacl/Access.h"
#include "server/mod_davacl/Locks.h"
#include "server/mod_davacl/Needs.h"
#include "server/mod_davacl/Uploads.h"

#include <algorithm>
#include <cstring>
#include <optional>
#include <string>
#include <vector>

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

// The trees below the base, as far as mod_dav_fs has them: the directory behind the base tells their owners. Nothing
// when it cannot be read.
std::optional<std::vector<std::string>> ownersOfTrees(request_rec* r, const Configuration& c) {
    request_rec* base = ap_sub_req_lookup_uri(apr_pstrcat(r->pool, c.base, "/", nullptr), r, nullptr);
    apr_dir_t* directory = nullptr;
    if (!base->filename || apr_dir_open(&directory, base->filename, r->pool) != APR_SUCCESS) return std::nullopt;
    std::vector<std::string> owners;
    apr_finfo_t entry;
    while (apr_dir_read(&entry, APR_FINFO_NAME, directory) == APR_SUCCESS)
        if (const std::string name = entry.name; name != "." && name != "..") owners.push_back(name);
    apr_dir_close(directory);
    return owners;
}

bool mayOnEveryTree(request_rec* r, const Configuration& c, unsigned needed) {
    const auto owners = ownersOfTrees(r, c);
    return owners && std::all_of(owners->begin(), owners->end(), [&](const std::string& owner) {
               return (privilegesOn(r, c, TreePath{owner, {}}) & needed) == needed;
           });
}

// A request may take in all trees without naming one of them.
bool reachesIntoForeignTrees(request_rec* r, const Configuration& c, bool destination) {
    const unsigned needed = destination ? neededOfMembersReplaced() : neededOfMembers(r->method, isDeep(r));
    return needed && !mayOnEveryTree(r, c, needed);
}

int refuseReach(request_rec* r) {
    if (r->main) return HTTP_FORBIDDEN;
    dav_error* error =
        dav_new_error_tag(r->pool, HTTP_FORBIDDEN, 0, 0,
                          "The request takes in all trees, and one of them at least is not yours to do that with.",
                          "DAV:", "need-privileges");
    ap_log_rerror(APLOG_MARK, APLOG_INFO, 0, r, "davacl: %s %s takes in trees of others", r->method, r->uri);
    boundUpload(r);
    ap_discard_request_body(r);
    return dav_handle_err(r, error, nullptr);
}

// Files that httpd would read as configuration where AllowOverride lets it.
bool namesConfiguration(const request_rec* r, const TreePath& place) {
    const auto* core = static_cast<const core_server_config*>(ap_get_core_module_config(r->server->module_config));
    const char* names = core->access_name ? core->access_name : "";
    while (*names) {
        const std::string name = ap_getword_conf(r->pool, &names);
        if (name == place.owner || std::find(place.below.begin(), place.below.end(), name) != place.below.end())
            return true;
    }
    return false;
}

int check(request_rec* r) {
    const Configuration* c = configurationOf(r);
    if (!c) return DECLINED;
    if (isAmongTheLists(r, *c)) return HTTP_FORBIDDEN;
    const auto place = TreePath::of(c->base, r->uri);
    const bool destination = isDestination(r);
    const bool takesInAll = place ? place->isBase() : isAbove(c->base, r->uri);
    // Every sub-request that asks where something lies ends here, too: it is no request of its own.
    if (takesInAll && (!r->main || destination) && reachesIntoForeignTrees(r, *c, destination)) return refuseReach(r);
    if (!place) return DECLINED;
    if (place->isTooLong()) return HTTP_REQUEST_URI_TOO_LARGE; // else mod_dav would fail in the middle
    if (place->isReserved() || namesConfiguration(r, *place)) return HTTP_FORBIDDEN;
    const Standing standing = standingOf(r);
    const auto missing =
        missingOf(r, *c, *place, destination ? needsOfDestination(r->method, standing) : needsOf(r->method, standing));
    if (!missing && !r->main)
        if (const auto within = missingWithin(r, *c, *place)) return refuse(r, *c, *within);
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
