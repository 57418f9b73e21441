#include "server/mod_davacl/Reports.h"

#include "server/mod_davacl/LiveProperties.h"
#include "server/mod_davacl/PrincipalResources.h"
#include "server/mod_davacl/ReportBody.h"
#include "server/mod_davacl/SyncCollection.h"
#include "server/mod_davacl/WaitingRequests.h"
#include "server/mod_davacl/XmlElements.h"

#include <algorithm>
#include <cstring>
#include <set>

namespace rolvane::davacl {
namespace {

constexpr size_t kMostResponses = 5000;
constexpr size_t kMostBytes = 8u << 20;
constexpr size_t kMostVisited = 20000;  // members of a tree, whether they are shown or not
constexpr size_t kMostSearches = 16;    // each may ask whether a user exists
constexpr size_t kDeepestExpansion = 8; // DAV:property elements within each other

struct Report {
    request_rec* r;
    const Configuration& c;
    const apr_xml_doc* doc;
    const dav_resource* resource = nullptr; // null: on principals
    std::string text = {};                  // the responses so far
    size_t responses = 0;
    dav_error* error = nullptr;

    bool hasRoom() const { return !error; }
    void fail(const char* precondition, const char* words) {
        if (!error) error = dav_new_error_tag(r->pool, HTTP_FORBIDDEN, 0, 0, words, "DAV:", precondition);
    }
    void refuse(const char* words) {
        if (!error) error = dav_new_error(r->pool, HTTP_BAD_REQUEST, 0, 0, words);
    }
    void count() {
        if (++responses > kMostResponses || text.size() > kMostBytes)
            fail("number-of-matches-within-limits", "The report would be too long.");
    }
    void add(const std::string& response) {
        if (!hasRoom()) return;
        text += response;
        count();
    }
};

std::string lowered(std::string text) {
    for (char& c : text)
        if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
    return text;
}

// Which principals the place of a request holds, by the path that names the users', the groups' or both.
bool isHeldBy(const Report& q, const Principal& principal) {
    if (q.resource) return false;
    const auto place = TreePath::of(q.c.principalBase(), q.r->uri);
    if (!place || !place->below.empty()) return false;
    return place->isBase() || (place->owner == "users") == (principal.kind == Principal::Kind::user);
}

// -- acl-principal-prop-set (section 9.2)

void principalsOfList(Report& q) {
    const auto place = TreePath::of(q.c.base, q.resource->uri);
    if (!place || place->isBase() || !(privilegesOn(q.r, q.c, *place) & kReadAcl))
        return q.fail("need-privileges", "The privilege read-acl is missing.");
    std::vector<Principal> named = {{Principal::Kind::user, place->owner}};
    std::set<Principal> seen(named.begin(), named.end());
    const OwnersLists* lists = listsOf(q.r, q.c, place->owner);
    for (TreePath at = *place; lists && !at.isBase(); at = at.parent()) {
        if (at.levels() > q.c.levels()) continue;
        for (const Grant& entry : lists->at(at.tree()))
            if (!entry.principal.name.empty() && seen.insert(entry.principal).second) named.push_back(entry.principal);
    }
    const auto wanted = namesIn(q.doc, child(q.doc->root, "prop"));
    for (const Principal& principal : named) {
        if (!q.hasRoom()) return;
        q.add(principalResponse(q.r, q.c, principal, wanted));
    }
}

// -- principal-match (section 9.3)

std::string hrefOfPrincipal(const Report& q, const Principal& principal) {
    return principalElement(q.r, q.c, principal);
}

bool identifiesTheUser(const Report& q, const std::string& value) {
    const auto own = ownPrincipals(q.r, q.c);
    return std::any_of(own.begin(), own.end(), [&](const Principal& principal) {
        return value.find(hrefOfPrincipal(q, principal)) != std::string::npos;
    });
}

// The properties of a resource of a tree, as PROPFIND has them, with more in front.
std::string responseOf(const Report& q, const dav_resource* resource, apr_xml_doc* names, const std::string& more) {
    dav_propdb* database = nullptr;
    if (dav_open_propdb(q.r, nullptr, resource, 1, names->namespaces, &database)) return {};
    const dav_get_props_result found = dav_get_props(database, names);
    std::string text = "<D:response";
    for (const apr_text* piece = found.xmlns; piece; piece = piece->next) text += piece->text;
    const std::string path = resource->uri;
    text += ">\n" + hrefElement(q.r, resource->collection && !path.ends_with('/') ? path + "/" : path) + "\n" + more;
    for (const apr_text* piece = found.propstats; piece; piece = piece->next) text += piece->text;
    dav_close_propdb(database);
    return text + "</D:response>\n";
}

struct Walk {
    Report& q;
    size_t visited = 0;

    static dav_error* step(dav_walk_resource* at, int) noexcept {
        auto& walk = *static_cast<Walk*>(at->walk_ctx);
        contained(walk.q.r, false, [&] {
            walk.visit(at->resource);
            return true;
        });
        return walk.q.error;
    }
    void visit(const dav_resource* resource) {
        if (++visited > kMostVisited)
            return q.fail("number-of-matches-within-limits", "The collection holds too much.");
        const auto place = TreePath::of(q.c.base, resource->uri);
        if (place && !place->isReserved() && (privilegesOn(q.r, q.c, *place) & kRead))
            q.add(responseOf(q, resource, const_cast<apr_xml_doc*>(q.doc), {}));
    }
};

// What is below the place and belongs to the user: the own tree, or nothing.
void matchOwned(Report& q) {
    const auto place = TreePath::of(q.c.base, q.resource->uri);
    const dav_resource* collection = q.resource;
    if (!place || (!place->isBase() && place->owner != q.r->user)) return;
    if (place->isBase()) {
        const std::string own = urlPathOf(q.r, q.c, TreePath{q.r->user, {}});
        request_rec* found = ap_sub_req_lookup_uri(own.c_str(), q.r, nullptr);
        dav_resource* tree = nullptr;
        if (found->status != HTTP_OK || dav_get_resource(found, 0, 0, &tree) || !tree->exists) return;
        collection = tree;
    }
    Walk walk{q};
    dav_walk_params parameters{};
    parameters.walk_type = DAV_WALKTYPE_NORMAL;
    parameters.func = Walk::step;
    parameters.walk_ctx = &walk;
    parameters.pool = q.r->pool;
    parameters.root = collection;
    dav_response* responses = nullptr;
    if (dav_error* error = collection->hooks->walk(&parameters, DAV_INFINITY, &responses))
        if (!q.error) q.error = error;
}

void matchPrincipals(Report& q) {
    const char* problem = nullptr;
    const auto match = parsePrincipalMatch(q.doc, problem);
    if (!match) return q.refuse(problem);
    const apr_xml_elem* name = match->property;
    if (q.resource) {
        if (name && (isDav(name, "owner") || isDav(name, "current-user-principal"))) matchOwned(q);
        return;
    }
    const auto wanted = namesIn(q.doc, child(q.doc->root, "prop"));
    for (const Principal& principal : ownPrincipals(q.r, q.c)) {
        if (!isHeldBy(q, principal)) continue;
        const auto value = name && name->ns == APR_XML_NS_DAV_ID ? principalValue(q.r, q.c, principal, name->name)
                                                                 : std::optional<std::string>();
        if (!name || (value && identifiesTheUser(q, *value))) q.add(principalResponse(q.r, q.c, principal, wanted));
    }
}

// -- principal-property-search (section 9.4)

// Only names are searched.
bool meets(const Principal& principal, const PropertySearch& search) {
    return std::all_of(search.properties.begin(), search.properties.end(), [&](const Wanted& property) {
        return property.space == "DAV:" && property.name == "displayname" &&
               lowered(principal.name).find(lowered(search.match)) != std::string::npos;
    });
}

// Whom the user may know of: those whom a listing shows, and whom the searches call by their whole name.
std::vector<Principal> searched(Report& q, const std::vector<PropertySearch>& searches) {
    std::vector<Principal> known = ownPrincipals(q.r, q.c);
    for (const PropertySearch& search : searches)
        for (const auto kind : {Principal::Kind::user, Principal::Kind::group}) {
            const Principal named{kind, search.match};
            if (isUsableName(search.match) && std::find(known.begin(), known.end(), named) == known.end() &&
                exists(q.r, q.c, named))
                known.push_back(named);
        }
    return known;
}

void searchPrincipals(Report& q) {
    const char* problem = nullptr;
    const auto read = parseSearches(q.doc, problem);
    if (!read) return q.refuse(problem);
    const std::vector<PropertySearch>& searches = *read;
    if (searches.size() > kMostSearches)
        return q.fail("number-of-matches-within-limits", "There are too many searches in one report.");
    const bool everywhere = child(q.doc->root, "apply-to-principal-collection-set");
    const auto wanted = namesIn(q.doc, child(q.doc->root, "prop"));
    for (const Principal& principal : searched(q, searches))
        if ((everywhere || isHeldBy(q, principal)) &&
            std::all_of(searches.begin(), searches.end(), [&](const PropertySearch& s) { return meets(principal, s); }))
            q.add(principalResponse(q.r, q.c, principal, wanted));
}

// -- expand-property (RFC 3253 section 3.8)

std::string expandedPrincipal(Report& q, const Principal& principal, const apr_xml_elem* properties);

// The text with the principals' responses in the place of their hrefs, when the property asks for something of theirs.
std::string expanded(Report& q, const std::string& value, const apr_xml_elem* property) {
    if (!child(property, "property")) return value;
    constexpr std::string_view open = "<D:href>", close = "</D:href>";
    std::string out;
    size_t done = 0;
    for (size_t at; q.hasRoom() && (at = value.find(open, done)) != std::string::npos;) {
        const size_t end = value.find(close, at);
        if (end == std::string::npos) break;
        const std::string href = unquoted(value.substr(at + open.size(), end - at - open.size()));
        out += value.substr(done, at - done);
        done = end + close.size();
        const auto principal = principalAt(q.r, q.c, href);
        out += principal ? expandedPrincipal(q, *principal, property) : value.substr(at, done - at);
        if (out.size() > kMostBytes) q.fail("number-of-matches-within-limits", "The report would be too long.");
    }
    return out + value.substr(done);
}

std::string expandedPrincipal(Report& q, const Principal& principal, const apr_xml_elem* properties) {
    q.count();
    std::string found, missing;
    for (const apr_xml_elem* e = properties->first_child; e && q.hasRoom(); e = e->next) {
        if (!isDav(e, "property")) continue;
        const Wanted wanted = nameOf(e);
        const auto value = wanted.space == "DAV:" ? principalValue(q.r, q.c, principal, wanted.name) : std::nullopt;
        if (value)
            found += "<D:" + wanted.name + ">" + expanded(q, *value, e) + "</D:" + wanted.name + ">";
        else
            missing += emptyElement(q.r->pool, wanted);
        if (found.size() + missing.size() > kMostBytes)
            q.fail("number-of-matches-within-limits", "The report would be too long.");
    }
    std::string text = "<D:response>\n" + principalElement(q.r, q.c, principal) + "\n";
    if (!found.empty() || missing.empty()) text += propstat(found, "200 OK");
    if (!missing.empty()) text += propstat(missing, "404 Not Found");
    return text + "</D:response>\n";
}

// A document as PROPFIND has it, with the properties that are not ours.
apr_xml_doc* othersIn(const Report& q, const std::vector<Wanted>& wanted) {
    apr_pool_t* pool = q.r->pool;
    auto* doc = static_cast<apr_xml_doc*>(apr_pcalloc(pool, sizeof(apr_xml_doc)));
    const auto element = [pool](const char* name, int space) {
        auto* made = static_cast<apr_xml_elem*>(apr_pcalloc(pool, sizeof(apr_xml_elem)));
        made->name = apr_pstrdup(pool, name);
        made->ns = space;
        return made;
    };
    doc->namespaces = apr_array_make(pool, 4, sizeof(const char*));
    apr_xml_insert_uri(doc->namespaces, "DAV:");
    doc->root = element("propfind", APR_XML_NS_DAV_ID);
    doc->root->first_child = element("prop", APR_XML_NS_DAV_ID);
    for (const Wanted& each : wanted) {
        const char* space = apr_xml_quote_string(pool, each.space.c_str(), 1); // as apr's own parser gives them
        apr_xml_elem* made = element(each.name.c_str(), apr_xml_insert_uri(doc->namespaces, space));
        made->next = doc->root->first_child->first_child;
        doc->root->first_child->first_child = made;
    }
    return doc;
}

void expandOnTree(Report& q) {
    std::string ours;
    std::vector<Wanted> others;
    for (const apr_xml_elem* e = q.doc->root->first_child; e && q.hasRoom(); e = e->next) {
        if (!isDav(e, "property")) continue;
        const Wanted wanted = nameOf(e);
        const auto element = wanted.space == "DAV:" ? livePropertyElement(q.resource, wanted.name) : std::nullopt;
        if (element)
            ours += expanded(q, *element, e);
        else
            others.push_back(wanted);
        if (ours.size() > kMostBytes) q.fail("number-of-matches-within-limits", "The report would be too long.");
    }
    if (q.hasRoom())
        q.add(responseOf(q, q.resource, othersIn(q, others), ours.empty() ? ours : propstat(ours, "200 OK")));
}

void expandProperties(Report& q) {
    if (isDeeperThan(q.doc->root, kDeepestExpansion + 1))
        return q.fail("number-of-matches-within-limits", "The properties are nested too deeply.");
    if (!areNamed(q.doc->root)) return q.refuse("DAV:property has the name of a property.");
    if (q.resource) return expandOnTree(q);
    const auto principal = principalAt(q.r, q.c, ap_os_escape_path(q.r->pool, q.r->uri, 1));
    if (principal) {
        const std::string text = expandedPrincipal(q, *principal, q.doc->root);
        q.add(text);
    }
}

// -- sync-collection (RFC 6578)

void synchronizeTree(Report& q) {
    const SyncAnswer answer = synchronize(q.r, q.resource, q.doc, [&q](const dav_resource* member) {
        return responseOf(q, member, const_cast<apr_xml_doc*>(q.doc), {});
    });
    q.error = answer.error;
    q.text = answer.text;
}

// -- all of them

void describeSearch(Report& q) {
    q.text = "<D:principal-search-property><D:prop><D:displayname/></D:prop>"
             "<D:description xml:lang=\"en\">Name</D:description></D:principal-search-property>\n";
}

enum class On { trees, everything, collections };
struct Known {
    const char* name;
    void (*answer)(Report&);
    On on;
    const char* root; // of the answer
};
constexpr Known kReports[] = {
    {"expand-property", expandProperties, On::everything, "multistatus"},
    {"acl-principal-prop-set", principalsOfList, On::trees, "multistatus"},
    {"principal-match", matchPrincipals, On::everything, "multistatus"},
    {"principal-property-search", searchPrincipals, On::everything, "multistatus"},
    {"principal-search-property-set", describeSearch, On::everything, "principal-search-property-set"},
    {"sync-collection", synchronizeTree, On::collections, "multistatus"}};

void send(const Report& q, const Known& report) {
    const std::string text = std::string("<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<D:") + report.root +
                             " xmlns:D=\"DAV:\">\n" + q.text + "</D:" + report.root + ">\n";
    q.r->status = std::strcmp(report.root, "multistatus") == 0 ? HTTP_MULTI_STATUS : HTTP_OK;
    ap_set_content_type(q.r, DAV_XML_CONTENT_TYPE);
    ap_set_content_length(q.r, static_cast<apr_off_t>(text.size()));
    ap_rwrite(text.data(), static_cast<int>(text.size()), q.r);
}

int answer(Report& q) {
    for (const Known& report : kReports) {
        if (!isDav(q.doc->root, report.name) || (!q.resource && report.on != On::everything)) continue;
        if (dav_get_depth(q.r, 0) != 0)
            q.refuse("The report is about the resource itself: send Depth 0, or none.");
        else if (!canBeAnswered(namesIn(q.doc, child(q.doc->root, "prop"))))
            q.refuse("A name of a property has two colons.");
        else
            report.answer(q);
        if (q.error) return q.error->status;
        send(q, report);
        return OK;
    }
    return DECLINED;
}

} // namespace

int reportOnTrees(request_rec* r, const dav_resource* resource, const apr_xml_doc* doc, ap_filter_t*,
                  dav_error** error) noexcept {
    return contained(r, static_cast<int>(HTTP_INTERNAL_SERVER_ERROR), [&]() -> int {
        const Configuration* c = configurationOf(r);
        if (!c || !r->user || !doc || !doc->root || !resource->uri || !TreePath::of(c->base, resource->uri))
            return DECLINED;
        if (isNewsReport(doc)) return waitForNews(r, *c, doc, error);
        Report q{r, *c, doc, resource};
        const int status = answer(q);
        *error = q.error;
        return status;
    });
}

int reportOnPrincipals(request_rec* r, const Configuration& c) {
    apr_xml_doc* doc = nullptr;
    if (const int status = ap_xml_parse_input(r, &doc)) return status;
    if (!doc || !doc->root) return HTTP_BAD_REQUEST;
    Report q{r, c, doc};
    const int status = answer(q);
    if (q.error) return dav_handle_err(r, q.error, nullptr);
    if (status != DECLINED) return status;
    return dav_handle_err(r,
                          dav_new_error_tag(r->pool, HTTP_FORBIDDEN, 0, 0, "This server does not have the report.",
                                            "DAV:", "supported-report"),
                          nullptr);
}

std::string supportedReports(bool ofTrees, bool ofCollections) {
    std::string text;
    for (const Known& report : kReports)
        if (report.on == On::everything || (report.on == On::trees && ofTrees) ||
            (report.on == On::collections && ofCollections))
            text +=
                std::string("<D:supported-report><D:report><D:") + report.name + "/></D:report></D:supported-report>";
    return text;
}

} // namespace rolvane::davacl
