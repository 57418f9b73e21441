#include "server/mod_davacl/LiveProperties.h"

#include "server/mod_davacl/Access.h"
#include "server/mod_davacl/MembersTag.h"
#include "server/mod_davacl/News.h"
#include "server/mod_davacl/PrincipalResources.h"
#include "server/mod_davacl/QuotaTurn.h"
#include "server/mod_davacl/ReportBody.h"
#include "server/mod_davacl/Reports.h"
#include "server/mod_davacl/SyncCollection.h"
#include "server/mod_davacl/WaitingRequests.h"

#include <string_view>

namespace rolvane::davacl {
namespace {

enum Property {
    kOwner = 0x3744,
    kSupportedPrivilegeSet,
    kCurrentUserPrivilegeSet,
    kAcl,
    kAclRestrictions,
    kInheritedAclSet,
    kPrincipalCollectionSet,
    kCurrentUserPrincipal,
    kSupportedReportSet,
    kSyncToken,
    kMembersTag,
    kQuotaUsed,
    kQuotaAvailable
};
const char* const kNamespaces[] = {"DAV:", kOwnNamespace, nullptr};
constexpr int kOwn = 1; // the place of kOwnNamespace there
const dav_liveprop_spec kProperties[] = {{0, "owner", kOwner, 0},
                                         {0, "supported-privilege-set", kSupportedPrivilegeSet, 0},
                                         {0, "current-user-privilege-set", kCurrentUserPrivilegeSet, 0},
                                         {0, "acl", kAcl, 0},
                                         {0, "acl-restrictions", kAclRestrictions, 0},
                                         {0, "inherited-acl-set", kInheritedAclSet, 0},
                                         {0, "principal-collection-set", kPrincipalCollectionSet, 0},
                                         {0, "current-user-principal", kCurrentUserPrincipal, 0},
                                         {0, "supported-report-set", kSupportedReportSet, 0},
                                         {0, "sync-token", kSyncToken, 0},
                                         {0, "quota-used-bytes", kQuotaUsed, 0},
                                         {0, "quota-available-bytes", kQuotaAvailable, 0},
                                         {kOwn, kMembersTagName, kMembersTag, 0},
                                         {0, nullptr, 0, 0}};

request_rec* requestOf(const dav_resource* resource) {
    return resource->hooks->get_request_rec ? resource->hooks->get_request_rec(resource) : nullptr;
}

struct Asked {
    request_rec* r;
    const Configuration& c;
    TreePath place;
};

std::string entryOf(const std::string& principal, const std::string& privileges, bool isProtected,
                    const std::string& inheritedFrom, bool denies = false) {
    const char* kind = denies ? "deny>" : "grant>";
    return "<D:ace><D:principal>" + principal + "</D:principal><D:" + kind + privileges + "</D:" + kind +
           (isProtected ? "<D:protected/>" : "") +
           (inheritedFrom.empty() ? "" : "<D:inherited>" + inheritedFrom + "</D:inherited>") + "</D:ace>\n";
}

std::string entriesOf(const Asked& a, const std::string& tree, const std::string& inheritedFrom) {
    std::string text;
    const OwnersLists* lists = listsOf(a.r, a.c, a.place.owner);
    if (!lists) return text;
    for (const Grant& grant : lists->at(tree))
        text += entryOf(principalElement(a.r, a.c, grant.principal),
                        std::string(grant.read ? "<D:privilege><D:read/></D:privilege>" : "") +
                            (grant.write ? "<D:privilege><D:write/></D:privilege>" : ""),
                        false, inheritedFrom, grant.denies);
    return text;
}

// The places above that have or may have a list, the nearest first.
std::vector<TreePath> ancestorsOf(const Asked& a) {
    std::vector<TreePath> above;
    for (TreePath up = a.place.parent(); !up.isBase(); up = up.parent())
        if (up.levels() <= a.c.levels()) above.push_back(up);
    return above;
}

// The entries of the list at a tree, made once a request: in a listing each member shows those of the places above it,
// and a copy for each member would take memory in proportion to members times entries.
const std::string& sharedEntriesOf(const Asked& a, const std::string& tree, const std::string& inheritedFrom) {
    auto& known = stateOf(a.r).entries;
    const auto key = std::make_pair(a.place.owner + "/" + tree, inheritedFrom);
    const auto found = known.find(key);
    return found != known.end() ? found->second : known.emplace(key, entriesOf(a, tree, inheritedFrom)).first->second;
}

// The list in pieces, which live as long as the request.
void appendWholeList(const Asked& a, apr_pool_t* pool, apr_text_header* text) {
    const auto above = ancestorsOf(a);
    const bool hasOwn = a.place.levels() <= a.c.levels();
    const std::string owners = entryOf("<D:property><D:owner/></D:property>", "<D:privilege><D:all/></D:privilege>",
                                       true, hasOwn || above.empty() ? std::string() : hrefOf(a.r, a.c, above.front()));
    apr_text_append(pool, text, apr_pstrdup(pool, owners.c_str()));
    if (hasOwn) apr_text_append(pool, text, sharedEntriesOf(a, a.place.tree(), {}).c_str());
    for (const TreePath& place : above)
        apr_text_append(pool, text, sharedEntriesOf(a, place.tree(), hrefOf(a.r, a.c, place)).c_str());
}

// Whether what is served there are files, as mod_dav_fs has them.
bool servesFiles(request_rec* r) {
    const char* provider = dav_get_provider_name(r);
    return provider && std::string_view(provider) == "filesystem";
}

std::string_view withoutSlash(std::string_view path) {
    return path.substr(0, path.find_last_not_of('/') + 1);
}

std::optional<std::string> tagOf(const Asked& a, const dav_resource* resource) {
    if (!resource->collection || !resource->exists || !(privilegesOn(a.r, a.c, a.place) & kRead)) return std::nullopt;
    const auto directory = directoryOf(a.r, resource);
    timespec now{};
    clock_gettime(CLOCK_REALTIME, &now);
    return directory ? membersTag(*directory, int64_t{now.tv_sec} * 1000000000 + now.tv_nsec) : std::nullopt;
}

// RFC 4331, for whoever may put something there: how much a tree holds concerns nobody else.
std::optional<std::string> quotaOf(const Asked& a, int property, const dav_resource* resource) {
    if (!a.c.keepsQuotas() || a.place.isBase() || !resource->collection || !resource->exists ||
        !(privilegesOn(a.r, a.c, a.place) & kBind))
        return std::nullopt;
    const auto directory = directoryOf(a.r, resource);
    if (!directory) return std::nullopt;
    const auto figures = quotaFiguresOf(a.r, a.c, {a.place, *directory, true});
    if (!figures) return std::nullopt;
    if (property == kQuotaUsed) return std::to_string(figures->used);
    return figures->available ? std::optional(std::to_string(*figures->available)) : std::nullopt;
}

// Nothing: not defined there, or not for this user.
std::optional<std::string> valueOf(const Asked& a, int property, const dav_resource* resource) {
    const unsigned mine = privilegesOn(a.r, a.c, a.place);
    switch (property) {
    case kOwner:
        if (a.place.isBase()) return std::string();
        return hrefElement(a.r, userPath(a.c, a.place.owner));
    case kSupportedPrivilegeSet: return supportedPrivileges();
    case kCurrentUserPrivilegeSet:
        if (!(mine & kReadCurrentUserPrivilegeSet)) return std::nullopt;
        return privilegeElements(mine);
    case kAclRestrictions: return "<D:no-invert/>";
    case kInheritedAclSet: {
        std::string text;
        if (!a.place.isBase())
            for (const TreePath& place : ancestorsOf(a)) text += hrefOf(a.r, a.c, place);
        return text;
    }
    case kPrincipalCollectionSet: return principalCollections(a.r, a.c);
    case kSupportedReportSet:
        return supportedReports(true, canSynchronize(a.r, resource)) +
               (tellsNews(a.r) ? newsReportElement() : std::string());
    case kCurrentUserPrincipal: return currentUserPrincipal(a.r, a.c);
    case kQuotaUsed:
    case kQuotaAvailable: return quotaOf(a, property, resource);
    default: return std::nullopt;
    }
}

dav_prop_insert insertProperty(const dav_resource* resource, int property, dav_prop_insert what,
                               apr_text_header* text) noexcept {
    request_rec* r = requestOf(resource);
    if (!r) return DAV_PROP_INSERT_NOTDEF;
    return contained(r, DAV_PROP_INSERT_NOTDEF, [&] {
        const Configuration* c = configurationOf(r);
        const auto place = c && resource->uri ? TreePath::of(c->base, resource->uri) : std::nullopt;
        if (!place) return DAV_PROP_INSERT_NOTDEF;
        const bool ofQuota = property == kQuotaUsed || property == kQuotaAvailable;
        if (ofQuota && (!c->keepsQuotas() || !resource->collection)) return DAV_PROP_INSERT_NOTDEF;
        const dav_liveprop_spec* spec = nullptr;
        dav_get_liveprop_info(property, &kLiveProperties, &spec);
        const bool own = spec->ns == kOwn;
        const std::string name = (own ? "R:" : "D:") + std::string(spec->name);
        const std::string start = name + (own ? std::string(" xmlns:R=\"") + kOwnNamespace + "\"" : std::string());
        std::string out = "<" + start + "/>\n";
        if (what == DAV_PROP_INSERT_SUPPORTED)
            out = "<D:supported-live-property D:name=\"" + std::string(spec->name) + "\" D:namespace=\"" +
                  kNamespaces[spec->ns] + "\"/>\n";
        if (what == DAV_PROP_INSERT_VALUE) {
            const Asked asked{r, *c, *place};
            if (property == kAcl) {
                if (place->isBase() || !(privilegesOn(r, *c, *place) & kReadAcl)) return DAV_PROP_INSERT_NOTDEF;
                apr_text_append(resource->pool, text, "<D:acl>");
                appendWholeList(asked, resource->pool, text);
                apr_text_append(resource->pool, text, "</D:acl>\n");
                return what;
            }
            const auto value = property == kMembersTag  ? tagOf(asked, resource)
                               : property == kSyncToken ? syncTokenOf(r, resource)
                                                        : valueOf(asked, property, resource);
            if (!value) return DAV_PROP_INSERT_NOTDEF;
            out = "<" + start + ">" + *value + "</" + name + ">\n";
        }
        apr_text_append(resource->pool, text, apr_pstrdup(resource->pool, out.c_str()));
        return what;
    });
}

// Of what is not writable mod_dav says 409; what is, it asks about, and the answer says why not.
int isWritable(const dav_resource*, int) noexcept {
    return 1;
}

dav_error* refusePatch(const dav_resource* resource, const apr_xml_elem*, int, void**, int*) noexcept {
    return dav_new_error_tag(resource->pool, HTTP_FORBIDDEN, 0, 0,
                             "cannot-modify-protected-property: the property is computed, or set by the ACL method.",
                             "DAV:", "cannot-modify-protected-property");
}

const dav_hooks_liveprop kHooks = {insertProperty, isWritable, kNamespaces, refusePatch,
                                   nullptr,        nullptr,    nullptr,     nullptr};

bool concerns(request_rec* r) {
    const Configuration* c = configurationOf(r);
    return c && TreePath::of(c->base, r->uri);
}

dav_error* addToHeader(request_rec* r, const dav_resource*, apr_text_header* text) noexcept {
    if (!contained(r, false, [r] { return concerns(r); })) return nullptr;
    apr_text_append(r->pool, text, "access-control");
    contained(r, false, [r] {
        announceNews(r);
        return true;
    });
    if (servesFiles(r)) apr_text_append(r->pool, text, kMembersTagClass);
    if (servesFiles(r)) apr_text_append(r->pool, text, kSyncClass);
    return nullptr;
}

dav_error* addToMethods(request_rec* r, const dav_resource*, apr_text_header* text) noexcept {
    if (contained(r, false, [r] { return concerns(r); })) apr_text_append(r->pool, text, "ACL");
    return nullptr;
}

} // namespace

const dav_liveprop_group kLiveProperties = {kProperties, kNamespaces, &kHooks};
const dav_options_provider kOptions = {addToHeader, addToMethods, nullptr};

std::optional<std::string> directoryOf(request_rec* r, const dav_resource* resource) {
    const std::string_view asked = withoutSlash(r->uri), path = withoutSlash(resource->uri);
    if (!r->filename || !servesFiles(r) || !path.starts_with(asked)) return std::nullopt;
    const std::string_view below = path.substr(asked.size());
    if (!below.empty() && below.front() != '/') return std::nullopt;
    return std::string(withoutSlash(r->filename)) + std::string(below);
}

std::optional<std::string> livePropertyElement(const dav_resource* resource, std::string_view name) {
    for (const dav_liveprop_spec* spec = kProperties; spec->name; ++spec) {
        if (spec->ns == kOwn || name != spec->name) continue;
        apr_text_header text{};
        if (insertProperty(resource, spec->propid, DAV_PROP_INSERT_VALUE, &text) != DAV_PROP_INSERT_VALUE) break;
        std::string all;
        for (const apr_text* piece = text.first; piece; piece = piece->next) all += piece->text;
        return all;
    }
    return std::nullopt;
}

int findLiveProperty(const dav_resource* resource, const char* space, const char* name,
                     const dav_hooks_liveprop** hooks) noexcept {
    const request_rec* r = requestOf(resource);
    return r && configurationOf(r) ? dav_do_find_liveprop(space, name, &kLiveProperties, hooks) : 0;
}

void insertAllLiveProperties(request_rec* r, const dav_resource* resource, dav_prop_insert what,
                             apr_text_header* text) noexcept {
    if (!configurationOf(r) || what == DAV_PROP_INSERT_VALUE) return;
    for (const dav_liveprop_spec* spec = kProperties; spec->name; ++spec)
        insertProperty(resource, spec->propid, what, text);
}

} // namespace rolvane::davacl
