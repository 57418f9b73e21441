#include "server/mod_davacl/PrincipalResources.h"

#include "server/mod_davacl/GroupFile.h"
#include "server/mod_davacl/PasswordChange.h"
#include "server/mod_davacl/Reports.h"

#include <cstring>
#include <set>
#include <sstream>
#include <vector>

namespace rolvane::davacl {
namespace {

// A password that nobody has: what matters is whether the provider knows the user.
constexpr const char* kNobodysPassword = "\x01no password\x01";

bool providerKnows(request_rec* r, const char* name, const std::string& user) {
    const auto* provider =
        static_cast<const authn_provider*>(ap_lookup_provider(AUTHN_PROVIDER_GROUP, name, AUTHN_PROVIDER_VERSION));
    if (!provider || !provider->check_password) return false;
    const authn_status status = provider->check_password(r, user.c_str(), kNobodysPassword);
    return status == AUTH_DENIED || status == AUTH_GRANTED || status == AUTH_USER_FOUND;
}

bool anyProviderKnows(request_rec* r, const Configuration& c, const std::string& user) {
    for (int i = 0; i < c.users->nelts; ++i)
        if (providerKnows(r, reinterpret_cast<const char* const*>(c.users->elts)[i], user)) return true;
    return false;
}

// Read once a request.
const std::set<std::string, std::less<>>& usersInFile(request_rec* r, const Configuration& c) {
    auto& users = stateOf(r).usersInFile;
    if (users) return *users;
    users.emplace();
    std::istringstream lines(fileText(c.userFile));
    for (std::string line; std::getline(lines, line);)
        if (const size_t colon = line.find(':'); colon != std::string::npos && line[0] != '#')
            users->insert(line.substr(0, colon));
    return *users;
}

// What a URL below the principals' base names.
struct Place {
    enum class Kind { root, users, groups, principal } kind = Kind::root;
    Principal principal;
};

std::optional<Place> placeAt(const Configuration& c, std::string_view path) {
    const auto tree = TreePath::of(c.principalBase(), path);
    if (!tree || tree->below.size() > 1) return std::nullopt;
    if (tree->isBase()) return Place{};
    const bool users = tree->owner == "users";
    if (!users && tree->owner != "groups") return std::nullopt;
    if (tree->below.empty()) return Place{users ? Place::Kind::users : Place::Kind::groups, {}};
    if (!isUsableName(tree->below[0])) return std::nullopt;
    return Place{Place::Kind::principal, {users ? Principal::Kind::user : Principal::Kind::group, tree->below[0]}};
}

std::string pathOf(const Configuration& c, const Place& place) {
    switch (place.kind) {
    case Place::Kind::root: return std::string(c.principalBase()) + "/";
    case Place::Kind::users: return userPath(c, "");
    case Place::Kind::groups: return groupPath(c, "");
    default: break;
    }
    return place.principal.kind == Principal::Kind::user ? userPath(c, place.principal.name)
                                                         : groupPath(c, place.principal.name);
}

// Read once a request.
const std::string& groupText(request_rec* r, const Configuration& c) {
    auto& text = stateOf(r).groupText;
    if (!text) text = c.groupFile ? fileText(c.groupFile) : std::string();
    return *text;
}

// Who is in a group, or which groups somebody is in. Shown to whom it concerns.
std::optional<std::string> membersOf(request_rec* r, const Configuration& c, const Principal& principal) {
    if (principal.kind != Principal::Kind::group) return std::nullopt;
    const auto users = usersIn(principal.name, groupText(r, c));
    if (!users.contains(r->user)) return std::nullopt;
    std::string text;
    for (const std::string& user : users) text += hrefElement(r, userPath(c, user));
    return text;
}

std::optional<std::string> membershipOf(request_rec* r, const Configuration& c, const Principal& principal) {
    if (principal.kind == Principal::Kind::group) return std::string();
    if (principal.name != r->user) return std::nullopt;
    std::string text;
    for (const std::string& group : groupsOf(principal.name, groupText(r, c)))
        text += hrefElement(r, groupPath(c, group));
    return text;
}

constexpr const char* kProperties[] = {"resourcetype",
                                       "displayname",
                                       "principal-URL",
                                       "alternate-URI-set",
                                       "group-member-set",
                                       "group-membership",
                                       "principal-collection-set",
                                       "current-user-principal",
                                       "current-user-privilege-set",
                                       "supported-privilege-set",
                                       "acl-restrictions",
                                       "owner",
                                       "acl",
                                       "inherited-acl-set",
                                       "supported-report-set"};

// DAV:self (RFC 3744 section 5.5.1): the principal is the user, or a group of theirs.
bool isSelf(request_rec* r, const Configuration& c, const Principal& principal) {
    if (principal.kind == Principal::Kind::user) return principal.name == r->user;
    return groupsOf(r->user, groupText(r, c)).contains(principal.name);
}

// Nobody can change it: principals are what the administrator's files say.
constexpr const char* kAclOfPrincipals =
    "<D:ace><D:principal><D:authenticated/></D:principal><D:grant><D:privilege><D:read/></D:privilege></D:grant>"
    "<D:protected/></D:ace><D:ace><D:principal><D:self/></D:principal><D:grant><D:privilege><D:read-acl/>"
    "</D:privilege></D:grant><D:protected/></D:ace>";

std::optional<std::string> valueOf(request_rec* r, const Configuration& c, const Place& place, std::string_view name) {
    const bool isPrincipal = place.kind == Place::Kind::principal;
    const bool self = isPrincipal && isSelf(r, c, place.principal);
    if (name == "resourcetype") return isPrincipal ? "<D:principal/>" : "<D:collection/>";
    if (name == "principal-collection-set") return principalCollections(r, c);
    if (name == "current-user-principal") return currentUserPrincipal(r, c);
    if (name == "current-user-privilege-set") return privilegeElements(self ? kReading | kReadAcl : kReading);
    if (name == "supported-report-set") return supportedReports(false);
    if (name == "inherited-acl-set") return std::string();
    if (name == "supported-privilege-set") return supportedPrivileges();
    if (name == "acl-restrictions") return "<D:no-invert/>";
    if (!isPrincipal) return std::nullopt;
    if (name == "displayname") return apr_xml_quote_string(r->pool, place.principal.name.c_str(), 0);
    if (name == "principal-URL") return hrefElement(r, pathOf(c, place));
    if (name == "alternate-URI-set") return std::string();
    if (name == "group-member-set") return membersOf(r, c, place.principal);
    if (name == "group-membership") return membershipOf(r, c, place.principal);
    if (name == "owner") return place.principal.kind == Principal::Kind::user ? hrefElement(r, pathOf(c, place)) : "";
    if (name == "acl" && self) return kAclOfPrincipals;
    return std::nullopt;
}

// What the body asks for. False when it is no DAV:propfind.
bool readBody(const apr_xml_doc* doc, std::vector<Wanted>& wanted, bool& namesOnly) {
    const auto all = [&wanted](size_t count) {
        for (size_t i = 0; i < count; ++i) wanted.push_back({"DAV:", kProperties[i]});
    };
    if (!doc || !doc->root) {
        all(2);
        return true;
    }
    if (!dav_validate_root(doc, "propfind")) return false;
    if (dav_find_child(doc->root, "allprop")) {
        all(2);
        return true;
    }
    if (dav_find_child(doc->root, "propname")) {
        namesOnly = true;
        all(std::size(kProperties));
        return true;
    }
    const apr_xml_elem* prop = dav_find_child(doc->root, "prop");
    if (!prop) return false;
    wanted = namesIn(doc, prop);
    return canBeAnswered(wanted);
}

std::string responseFor(request_rec* r, const Configuration& c, const Place& place, const std::vector<Wanted>& wanted,
                        bool namesOnly) {
    std::string found, missing;
    for (const Wanted& property : wanted) {
        const auto value = property.space == "DAV:" ? valueOf(r, c, place, property.name) : std::nullopt;
        if (!value) {
            if (!namesOnly) missing += emptyElement(r->pool, property);
            continue;
        }
        found += namesOnly || value->empty() ? emptyElement(r->pool, property)
                                             : "<D:" + property.name + ">" + *value + "</D:" + property.name + ">";
    }
    std::string text = "<D:response>\n" + hrefElement(r, pathOf(c, place)) + "\n";
    if (!found.empty() || missing.empty()) text += propstat(found, "200 OK");
    if (!missing.empty()) text += propstat(missing, "404 Not Found");
    return text + "</D:response>\n";
}

std::vector<Place> membersOf(request_rec* r, const Configuration& c, const Place& place) {
    std::vector<Place> members;
    if (place.kind == Place::Kind::root) members = {{Place::Kind::users, {}}, {Place::Kind::groups, {}}};
    if (place.kind == Place::Kind::users) members = {{Place::Kind::principal, {Principal::Kind::user, r->user}}};
    if (place.kind == Place::Kind::groups)
        for (const std::string& group : groupsOf(r->user, groupText(r, c)))
            members.push_back({Place::Kind::principal, {Principal::Kind::group, group}});
    return members;
}

int propfind(request_rec* r, const Configuration& c, const Place& place) {
    const int depth = dav_get_depth(r, DAV_INFINITY);
    if (depth < 0) return HTTP_BAD_REQUEST;
    apr_xml_doc* doc = nullptr;
    if (const int status = ap_xml_parse_input(r, &doc)) return status;
    if (depth == DAV_INFINITY)
        return dav_handle_err(
            r,
            dav_new_error_tag(r->pool, HTTP_FORBIDDEN, 0, 0, "Ask with Depth 0 or 1.", "DAV:", "propfind-finite-depth"),
            nullptr);
    std::vector<Wanted> wanted;
    bool namesOnly = false;
    if (!readBody(doc, wanted, namesOnly)) return HTTP_BAD_REQUEST;
    std::string text = "<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<D:multistatus xmlns:D=\"DAV:\">\n" +
                       responseFor(r, c, place, wanted, namesOnly);
    if (depth == 1)
        for (const Place& member : membersOf(r, c, place)) text += responseFor(r, c, member, wanted, namesOnly);
    text += "</D:multistatus>\n";
    r->status = HTTP_MULTI_STATUS;
    ap_set_content_type(r, DAV_XML_CONTENT_TYPE);
    ap_set_content_length(r, static_cast<apr_off_t>(text.size()));
    ap_rwrite(text.data(), static_cast<int>(text.size()), r);
    return OK;
}

std::string quoted(request_rec* r, const std::string& text) {
    return apr_xml_quote_string(r->pool, text.c_str(), 1);
}

std::string link(request_rec* r, const Configuration& c, const Place& place) {
    const std::string path = pathOf(c, place);
    const std::string name = place.kind == Place::Kind::principal ? place.principal.name : path;
    return "<li><a href=\"" + quoted(r, ap_os_escape_path(r->pool, path.c_str(), 1)) + "\">" + quoted(r, name) +
           "</a></li>\n";
}

// For whoever opens the address in a browser: what PROPFIND tells, as a page.
int page(request_rec* r, const Configuration& c, const Place& place) {
    const bool isPrincipal = place.kind == Place::Kind::principal;
    const bool isUser = place.principal.kind == Principal::Kind::user;
    const std::string title = !isPrincipal ? "Principals" : (isUser ? "User " : "Group ") + place.principal.name;
    std::string text = "<!DOCTYPE html>\n<html lang=\"en\"><head><meta charset=\"utf-8\"><title>" + quoted(r, title) +
                       "</title></head>\n<body><h1>" + quoted(r, title) + "</h1>\n<ul>\n";
    for (const Place& member : membersOf(r, c, place)) text += link(r, c, member);
    if (isPrincipal && isSelf(r, c, place.principal)) {
        const std::string& groups = groupText(r, c);
        for (const std::string& name :
             isUser ? groupsOf(place.principal.name, groups) : usersIn(place.principal.name, groups))
            text +=
                link(r, c, {Place::Kind::principal, {isUser ? Principal::Kind::group : Principal::Kind::user, name}});
    }
    text += "</ul></body></html>\n";
    ap_set_content_type(r, "text/html; charset=utf-8");
    apr_table_setn(r->headers_out, "Content-Security-Policy", "default-src 'none'");
    apr_table_setn(r->headers_out, "X-Content-Type-Options", "nosniff");
    apr_table_setn(r->headers_out, "Cache-Control", "private, no-cache");
    ap_set_content_length(r, static_cast<apr_off_t>(text.size()));
    if (!r->header_only) ap_rwrite(text.data(), static_cast<int>(text.size()), r);
    return OK;
}

int serve(request_rec* r) {
    const Configuration* c = configurationOf(r);
    if (!c || !TreePath::of(c->principalBase(), r->uri)) return DECLINED;
    if (!r->user) {
        if (!ap_auth_type(r)) return HTTP_FORBIDDEN;
        ap_note_auth_failure(r);
        return HTTP_UNAUTHORIZED;
    }
    const auto place = placeAt(*c, r->uri);
    if (!place || (place->kind == Place::Kind::principal && !exists(r, *c, place->principal))) return HTTP_NOT_FOUND;
    apr_table_setn(r->headers_out, "DAV", "1, access-control");
    apr_table_setn(r->headers_out, "Allow", "OPTIONS, GET, HEAD, PROPFIND, REPORT");
    if (std::strcmp(r->method, "OPTIONS") == 0) {
        ap_set_content_length(r, 0);
        return OK;
    }
    if (std::strcmp(r->method, "PROPFIND") == 0) return propfind(r, *c, *place);
    if (r->method_number == M_GET) return page(r, *c, *place); // HEAD, too
    if (std::strcmp(r->method, "REPORT") == 0) return reportOnPrincipals(r, *c);
    if (r->method_number == M_POST && place->kind == Place::Kind::principal && isSelf(r, *c, place->principal))
        return changePassword(r);
    return HTTP_METHOD_NOT_ALLOWED;
}

} // namespace

int servePrincipals(request_rec* r) noexcept {
    return contained(r, static_cast<int>(HTTP_INTERNAL_SERVER_ERROR), [r] { return serve(r); });
}

std::string propstat(const std::string& properties, const char* status) {
    return "<D:propstat>\n<D:prop>" + properties + "</D:prop>\n<D:status>HTTP/1.1 " + status +
           "</D:status>\n</D:propstat>\n";
}

std::string principalResponse(request_rec* r, const Configuration& c, const Principal& principal,
                              const std::vector<Wanted>& wanted) {
    const Place place{Place::Kind::principal, principal};
    if (exists(r, c, principal)) return responseFor(r, c, place, wanted, false);
    return "<D:response>\n" + hrefElement(r, pathOf(c, place)) +
           "\n<D:status>HTTP/1.1 404 Not Found</D:status>\n</D:response>\n";
}

std::optional<std::string> principalValue(request_rec* r, const Configuration& c, const Principal& principal,
                                          std::string_view name) {
    return valueOf(r, c, {Place::Kind::principal, principal}, name);
}

std::vector<Principal> ownPrincipals(request_rec* r, const Configuration& c) {
    std::vector<Principal> own = {{Principal::Kind::user, r->user}};
    for (const std::string& group : groupsOf(r->user, groupText(r, c))) own.push_back({Principal::Kind::group, group});
    return own;
}

std::string userPath(const Configuration& c, const std::string& user) {
    return std::string(c.principalBase()) + "/users/" + user;
}

std::string groupPath(const Configuration& c, const std::string& group) {
    return std::string(c.principalBase()) + "/groups/" + group;
}

std::string principalElement(request_rec* r, const Configuration& c, const Principal& principal) {
    switch (principal.kind) {
    case Principal::Kind::user: return hrefElement(r, userPath(c, principal.name));
    case Principal::Kind::group: return hrefElement(r, groupPath(c, principal.name));
    case Principal::Kind::all: return "<D:all/>";
    case Principal::Kind::unauthenticated: return "<D:unauthenticated/>";
    case Principal::Kind::authenticated: break;
    }
    return "<D:authenticated/>";
}

std::string principalCollections(request_rec* r, const Configuration& c) {
    return hrefElement(r, userPath(c, "")) + hrefElement(r, groupPath(c, ""));
}

std::string currentUserPrincipal(request_rec* r, const Configuration& c) {
    return r->user ? hrefElement(r, userPath(c, r->user)) : std::string("<D:unauthenticated/>");
}

bool exists(request_rec* r, const Configuration& c, const Principal& principal) {
    if (principal.name.empty()) return true;
    if (principal.kind == Principal::Kind::group) return groupsIn(groupText(r, c)).contains(principal.name);
    if ((!c.users && !c.userFile) || principal.name == r->user) return true;
    if (c.userFile && usersInFile(r, c).contains(principal.name)) return true;
    if (!c.users) return false;
    auto& known = stateOf(r).knownUsers;
    const auto found = known.find(principal.name);
    return found != known.end() ? found->second
                                : known.emplace(principal.name, anyProviderKnows(r, c, principal.name)).first->second;
}

std::optional<Principal> principalAt(request_rec* r, const Configuration& c, const std::string& href) {
    apr_uri_t uri;
    char* text = apr_pstrdup(r->pool, href.c_str());
    if (apr_uri_parse(r->pool, text, &uri) != APR_SUCCESS || !uri.path) return std::nullopt;
    if (uri.hostname && (!r->hostname || strcasecmp(uri.hostname, r->hostname) != 0)) return std::nullopt;
    if (ap_unescape_url(uri.path) != OK) return std::nullopt;
    char* clean = apr_pstrdup(r->pool, uri.path);
    ap_getparents(clean);
    if (std::strcmp(clean, uri.path) != 0) return std::nullopt;
    const auto place = placeAt(c, uri.path);
    if (!place || place->kind != Place::Kind::principal || !exists(r, c, place->principal)) return std::nullopt;
    return place->principal;
}

} // namespace rolvane::davacl
