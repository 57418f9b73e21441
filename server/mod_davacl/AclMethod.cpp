#include "server/mod_davacl/AclMethod.h"

#include "server/mod_davacl/Access.h"
#include "server/mod_davacl/Locks.h"
#include "server/mod_davacl/PrincipalResources.h"

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace rolvane::davacl {
namespace {

int aclMethodNumber = -1;

// A precondition of section 8.1.1 that the request does not meet.
struct Unmet {
    const char* precondition; // null: the body is malformed
    std::string words;
};

struct Request {
    request_rec* r;
    const Configuration& c;
    TreePath place;
};

const apr_xml_elem* child(const apr_xml_elem* of, const char* name) {
    return of ? dav_find_child(of, name) : nullptr;
}

size_t countOf(const apr_xml_elem* of, const char* name) {
    size_t count = 0;
    for (const apr_xml_elem* e = of ? of->first_child : nullptr; e; e = e->next)
        if (e->ns == APR_XML_NS_DAV_ID && std::strcmp(e->name, name) == 0) ++count;
    return count;
}

size_t elementsIn(const apr_xml_elem* of) {
    size_t count = 0;
    for (const apr_xml_elem* e = of ? of->first_child : nullptr; e; e = e->next) ++count;
    return count;
}

std::string textOf(request_rec* r, const apr_xml_elem* element) {
    const char* text = dav_xml_get_cdata(element, r->pool, 1);
    return text ? text : "";
}

bool namesOwner(const Request& q, const apr_xml_elem* principal) {
    if (const apr_xml_elem* property = child(principal, "property")) return child(property, "owner");
    const apr_xml_elem* href = child(principal, "href");
    const auto named = href ? principalAt(q.r, q.c, textOf(q.r, href)) : std::nullopt;
    return named && *named == Principal{Principal::Kind::user, q.place.owner};
}

// An entry that was read here and came back as it was is not set again; a changed one is refused.
std::optional<Unmet> checkProtected(const Request& q, const apr_xml_elem* ace) {
    if (!namesOwner(q, child(ace, "principal")) || child(ace, "deny"))
        return Unmet{"no-protected-ace-conflict", "The owner's own entry cannot be changed."};
    return std::nullopt;
}

std::optional<Unmet> checkInherited(const Request& q, const apr_xml_elem* ace) {
    const apr_xml_elem* href = child(child(ace, "inherited"), "href");
    if (href) {
        for (TreePath up = q.place.parent(); !up.isBase(); up = up.parent())
            if (hrefOf(q.r, q.c, up).find(">" + textOf(q.r, href) + "<") != std::string::npos) return std::nullopt;
    }
    return Unmet{"no-inherited-ace-conflict", "An inherited entry is set where it comes from."};
}

// Whom the entry grants something to; nothing with `unmet` set when it may not.
std::optional<Principal> readPrincipal(const Request& q, const apr_xml_elem* principal, std::optional<Unmet>& unmet) {
    if (child(principal, "authenticated")) return Principal{Principal::Kind::authenticated, {}};
    if (namesOwner(q, principal)) return Principal{Principal::Kind::user, q.place.owner};
    const apr_xml_elem* href = child(principal, "href");
    if (!href) {
        unmet = Unmet{"allowed-principal", "Users, groups, the owner and DAV:authenticated can be granted something."};
        return std::nullopt;
    }
    auto named = principalAt(q.r, q.c, textOf(q.r, href));
    if (!named) unmet = Unmet{"recognized-principal", "This server does not know the principal."};
    return named;
}

std::optional<Unmet> readPrivileges(const apr_xml_elem* grant, Grant& into) {
    bool any = false;
    for (const apr_xml_elem* privilege = grant->first_child; privilege; privilege = privilege->next) {
        if (privilege->ns != APR_XML_NS_DAV_ID || std::strcmp(privilege->name, "privilege") != 0 ||
            !privilege->first_child)
            return Unmet{nullptr, "DAV:grant holds DAV:privilege elements."};
        for (const apr_xml_elem* name = privilege->first_child; name; name = name->next) {
            const PrivilegeUse use = name->ns == APR_XML_NS_DAV_ID ? useOf(name->name) : PrivilegeUse::unknown;
            if (use == PrivilegeUse::abstract)
                return Unmet{"no-abstract", "Only DAV:read and DAV:write can be granted."};
            if (use == PrivilegeUse::unknown)
                return Unmet{"not-supported-privilege", "Only DAV:read and DAV:write can be granted."};
            (std::strcmp(name->name, "read") == 0 ? into.read : into.write) = true;
            any = true;
        }
    }
    return any ? std::nullopt : std::optional(Unmet{nullptr, "DAV:grant is empty."});
}

// RFC 3744 section 5.5: one principal, who is one, and either grants or denials.
bool isWellFormed(const apr_xml_elem* ace) {
    const size_t principals = countOf(ace, "principal") + countOf(ace, "invert");
    const apr_xml_elem* principal = child(child(ace, "invert") ? child(ace, "invert") : ace, "principal");
    if (principals != 1 || elementsIn(principal) != 1 || countOf(ace, "grant") + countOf(ace, "deny") != 1)
        return false;
    const apr_xml_elem* property = child(principal, "property");
    return !property || elementsIn(property) == 1;
}

std::optional<Unmet> readEntry(const Request& q, const apr_xml_elem* ace, AccessList& list) {
    if (!isWellFormed(ace))
        return Unmet{nullptr, "DAV:ace holds one DAV:principal, with one element in it, and one DAV:grant."};
    if (child(ace, "protected")) return checkProtected(q, ace);
    if (child(ace, "inherited")) return checkInherited(q, ace);
    if (child(ace, "invert")) return Unmet{"no-invert", "Inverted principals are not supported."};
    if (child(ace, "deny")) return Unmet{"grant-only", "What is not granted is denied."};
    const apr_xml_elem* principal = child(ace, "principal");
    const apr_xml_elem* grant = child(ace, "grant");
    Grant asked;
    std::optional<Unmet> unmet;
    const auto who = readPrincipal(q, principal, unmet);
    if (!who) return unmet;
    if (auto wrong = readPrivileges(grant, asked)) return wrong;
    asked.principal = *who;
    // The owner has everything anyway.
    if (*who != Principal{Principal::Kind::user, q.place.owner}) addGrant(list, asked);
    return std::nullopt;
}

std::optional<Unmet> readList(const Request& q, const apr_xml_doc* doc, AccessList& list) {
    if (!doc || !doc->root || !dav_validate_root(doc, "acl")) return Unmet{nullptr, "The body must be a DAV:acl."};
    // Before anybody is asked who they are: each entry may cost a look-up.
    if (countOf(doc->root, "ace") > q.c.mostEntries())
        return Unmet{"limited-number-of-aces",
                     "A list holds at most " + std::to_string(q.c.mostEntries()) + " entries."};
    for (const apr_xml_elem* e = doc->root->first_child; e; e = e->next) {
        if (e->ns != APR_XML_NS_DAV_ID || std::strcmp(e->name, "ace") != 0) continue;
        if (auto unmet = readEntry(q, e, list)) return unmet;
    }
    return std::nullopt;
}

int answerUnmet(request_rec* r, const Unmet& unmet) {
    const char* words = apr_pstrdup(r->pool, unmet.words.c_str());
    dav_error* error = unmet.precondition
                           ? dav_new_error_tag(r->pool, HTTP_FORBIDDEN, 0, 0, words, "DAV:", unmet.precondition)
                           : dav_new_error(r->pool, HTTP_BAD_REQUEST, 0, 0, words);
    return dav_handle_err(r, error, nullptr);
}

bool grantsWriting(const AccessList& list, const Principal& principal) {
    return std::any_of(list.begin(), list.end(),
                       [&](const Grant& grant) { return grant.write && grant.principal == principal; });
}

bool takesWritingFromSomebody(const AccessList& before, const AccessList& after) {
    return std::any_of(before.begin(), before.end(),
                       [&](const Grant& grant) { return grant.write && !grantsWriting(after, grant.principal); });
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
    if (const auto unmet = readList(q, doc, list)) return answerUnmet(r, *unmet);
    if (!isUsableName(place->owner)) return HTTP_FORBIDDEN;
    const bool mayHaveOne = resource->collection && place->levels() <= c->levels();
    if (!mayHaveOne && !list.empty())
        return answerUnmet(r, {"limited-number-of-aces", "Lists are set on the collections near the owner's root: " +
                                                             std::to_string(c->levels()) + " levels have them."});
    if (mayHaveOne)
        if (const int status = store(q, resource, std::move(list)); status != OK) return status;
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
