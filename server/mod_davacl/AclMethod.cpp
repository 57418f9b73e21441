#include "server/mod_davacl/AclMethod.h"

#include "server/mod_davacl/Access.h"
#include "server/mod_davacl/AclBody.h"
#include "server/mod_davacl/Locks.h"
#include "server/mod_davacl/News.h"
#include "server/mod_davacl/PrincipalResources.h"

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace rolvane::davacl {
namespace {

int aclMethodNumber = -1;

struct Request {
    request_rec* r;
    const Configuration& c;
    TreePath place;
};

int answerUnmet(request_rec* r, const Unmet& unmet) {
    const char* words = apr_pstrdup(r->pool, unmet.words.c_str());
    dav_error* error = unmet.precondition
                           ? dav_new_error_tag(r->pool, HTTP_FORBIDDEN, 0, 0, words, "DAV:", unmet.precondition)
                           : dav_new_error(r->pool, HTTP_BAD_REQUEST, 0, 0, words);
    return dav_handle_err(r, error, nullptr);
}

bool grantsWriting(const AccessList& list, const Principal& principal) {
    return std::any_of(list.begin(), list.end(), [&](const Grant& grant) {
        return grant.write && !grant.denies && grant.principal == principal;
    });
}

// May be true without need: where there are denials, the order decides.
bool takesWritingFromSomebody(const AccessList& before, const AccessList& after) {
    return std::any_of(after.begin(), after.end(), [](const Grant& entry) { return entry.denies && entry.write; }) ||
           std::any_of(before.begin(), before.end(), [&](const Grant& grant) {
               return grant.write && !grant.denies && !grantsWriting(after, grant.principal);
           });
}

AclPlace placeOf(const Request& q) {
    AclPlace place;
    place.owner = q.place.owner;
    place.mostEntries = q.c.mostEntries();
    for (TreePath up = q.place.parent(); !up.isBase(); up = up.parent()) place.above.push_back(urlPathOf(q.r, q.c, up));
    place.principalAt = [&q](const std::string& href) { return principalAt(q.r, q.c, href); };
    return place;
}

int store(const Request& q, const dav_resource* collection, AccessList list) {
    const ListStore lists(q.c.lists);
    const auto guard = lists.guard(q.place.owner, ListStore::Hold::exclusive);
    auto known = guard ? lists.read(q.place.owner) : std::nullopt;
    if (known) {
        const bool takesWriting = takesWritingFromSomebody(known->at(q.place.tree()), list);
        known->set(q.place.tree(), std::move(list));
        if (lists.write(q.place.owner, *known)) {
            if (takesWriting) removeLocksWithoutRight(q.r, q.c, collection, *known);
            return OK;
        }
    }
    ap_log_rerror(
        APLOG_MARK, APLOG_ERR, errno, q.r,
        "davacl: the access list of %s could not be changed: look whether %s can be written and is not damaged",
        q.r->uri, lists.pathFor(q.place.owner).c_str());
    return HTTP_INTERNAL_SERVER_ERROR;
}

int serve(request_rec* r) {
    if (r->method_number != aclMethodNumber || !r->handler || std::strcmp(r->handler, "dav-handler") != 0)
        return DECLINED;
    const Configuration* c = configurationOf(r);
    const auto place = c ? TreePath::of(c->base, r->uri) : std::nullopt;
    if (!place) return DECLINED;
    apr_xml_doc* doc = nullptr;
    if (const int status = ap_xml_parse_input(r, &doc)) return status;
    dav_resource* resource = nullptr;
    if (dav_error* error = dav_get_resource(r, 0, 0, &resource)) return dav_handle_err(r, error, nullptr);
    if (!resource->exists) return HTTP_NOT_FOUND;
    dav_response* responses = nullptr;
    // Nobody keeps the owner from taking rights back by locking the tree.
    if (dav_error* error = dav_validate_request(r, resource, 0, nullptr, &responses, DAV_VALIDATE_RESOURCE, nullptr))
        if (error->status != HTTP_LOCKED || !isLockedByOthersOnly(r, resource))
            return dav_handle_err(r, error, responses);

    const Request q{r, *c, *place};
    AccessList list;
    if (const auto unmet = readAclBody(doc, placeOf(q), list)) return answerUnmet(r, *unmet);
    if (!isUsableName(place->owner)) return HTTP_FORBIDDEN;
    const bool mayHaveOne = resource->collection && place->levels() <= c->levels();
    if (!mayHaveOne && !list.empty())
        return answerUnmet(r, {"limited-number-of-aces", "Lists are set on the collections near the owner's root: " +
                                                             std::to_string(c->levels()) + " levels have them."});
    if (mayHaveOne)
        if (const int status = store(q, resource, std::move(list)); status != OK) return status;
    noteChange(r, *c, *place);
    r->status = HTTP_OK;
    ap_set_content_length(r, 0);
    return OK;
}

} // namespace

int serveAcl(request_rec* r) noexcept {
    return contained(r, static_cast<int>(HTTP_INTERNAL_SERVER_ERROR), [r] { return serve(r); });
}

void registerAclMethod(apr_pool_t* pool) {
    aclMethodNumber = ap_method_register(pool, "ACL");
}

} // namespace rolvane::davacl
