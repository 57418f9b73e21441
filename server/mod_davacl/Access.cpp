#include "server/mod_davacl/Access.h"

#include "server/mod_davacl/GroupFile.h"
#include "server/mod_davacl/Uploads.h"

#include <cstring>
#include <fstream>
#include <sstream>
#include <sys/stat.h>

namespace rolvane::davacl {
namespace {

request_rec* mainOf(request_rec* r) {
    while (r->main) r = r->main;
    return r;
}

apr_status_t destroyState(void* state) {
    delete static_cast<RequestState*>(state);
    return APR_SUCCESS;
}

OwnersLists::Granted grantedBy(request_rec* r, const Configuration& c, const OwnersLists* lists) {
    if (!lists || lists->empty()) return {};
    Caller caller{r->user, {}};
    if (lists->mentionsGroups()) {
        const auto groups = c.groupFile ? readableText(c.groupFile) : std::nullopt;
        caller.groupsKnown = groups.has_value();
        if (groups) caller.groups = groupsOf(r->user, *groups);
    }
    return lists->grantedTo(caller);
}

bool isGranted(request_rec* r, const Configuration& c, const TreePath& place, const Need& need) {
    const TreePath target = need.onParent ? place.parent() : place;
    // Of the base's members everybody may make and remove the own tree, and nothing else.
    if (need.onParent && target.isBase()) return r->user && !place.isBase() && place.owner == r->user;
    return privilegesOn(r, c, target) & need.privilege;
}

} // namespace

std::optional<std::string> readableText(const char* path) {
    const std::ifstream file(path, std::ios::binary);
    std::ostringstream text;
    if (!file || !(text << file.rdbuf())) { // an empty file, or one that cannot be read, a directory for instance
        struct stat info {};
        if (!file || stat(path, &info) != 0 || !S_ISREG(info.st_mode) || info.st_size != 0) return std::nullopt;
    }
    return text.str();
}

std::string fileText(const char* path) {
    return readableText(path).value_or(std::string());
}

RequestState& stateOf(request_rec* r) {
    request_rec* top = mainOf(r);
    auto* state = static_cast<RequestState*>(ap_get_module_config(top->request_config, &davacl_module));
    if (!state) {
        state = new RequestState;
        apr_pool_cleanup_register(top->pool, state, destroyState, apr_pool_cleanup_null);
        ap_set_module_config(top->request_config, &davacl_module, state);
    }
    return *state;
}

const OwnersLists* listsOf(request_rec* r, const Configuration& c, const std::string& owner) {
    auto& known = stateOf(r).lists;
    auto found = known.find(owner);
    if (found == known.end()) {
        found = known.emplace(owner, ListStore(c.lists).read(owner)).first;
        if (!found->second)
            ap_log_rerror(APLOG_MARK, APLOG_ERR, 0, r,
                          "davacl: the access lists of %s cannot be read or are damaged (%s): only the owner gets in",
                          owner.c_str(), ListStore(c.lists).pathFor(owner).c_str());
    }
    return found->second ? &*found->second : nullptr;
}

unsigned privilegesOn(request_rec* r, const Configuration& c, const TreePath& place) {
    if (!r->user || !*r->user) return 0;
    if (place.isBase()) return kReading; // its members are shown by their own lists
    if (place.owner == r->user) return kEverything;
    RequestState& state = stateOf(r);
    if (state.grantedTo != r->user) {
        state.grantedTo = r->user;
        state.granted.clear();
    }
    auto found = state.granted.find(place.owner);
    if (found == state.granted.end())
        found = state.granted.emplace(place.owner, grantedBy(r, c, listsOf(r, c, place.owner))).first;
    return OwnersLists::together(found->second, place.below);
}

std::optional<Missing> missingOf(request_rec* r, const Configuration& c, const TreePath& place,
                                 const std::vector<Need>& needs) {
    for (const Need& need : needs)
        if (!isGranted(r, c, place, need)) return Missing{need.onParent ? place.parent() : place, need.privilege};
    return std::nullopt;
}

bool isDeep(const request_rec* r) {
    const char* depth = apr_table_get(r->headers_in, "Depth");
    if (!depth) return std::strcmp(r->method, "REPORT") != 0;
    return std::strcmp(depth, "0") != 0 && std::strcmp(depth, "1") != 0;
}

std::optional<Missing> missingWithin(request_rec* r, const Configuration& c, const TreePath& place) {
    // A LOCK without a body renews one that is there.
    const bool renews = std::strcmp(r->method, "LOCK") == 0 && !ap_request_has_body(r);
    const unsigned needed = renews ? 0 : neededWithin(r->method, isDeep(r));
    if (!needed || place.isBase() || (r->user && place.owner == r->user)) return std::nullopt;
    const OwnersLists* lists = listsOf(r, c, place.owner);
    if (!lists) return std::nullopt; // damaged: nobody but the owner has a right
    for (const std::string& tree : lists->trees()) {
        const auto within = TreePath::of("", "/" + place.owner + "/" + tree);
        if (within && within->isWithin(place) && (privilegesOn(r, c, *within) & needed) != needed)
            return Missing{place, static_cast<Privilege>(needed)};
    }
    return std::nullopt;
}

Standing standingOf(const request_rec* r) {
    if (r->finfo.filetype == APR_NOFILE || (r->path_info && *r->path_info)) return Standing::nothing;
    return r->finfo.filetype == APR_DIR ? Standing::collection : Standing::file;
}

namespace {

std::string escapedPath(request_rec* r, const std::string& path) {
    return ap_os_escape_path(r->pool, path.c_str(), 1);
}

std::string hrefTo(request_rec* r, const std::string& urlPath) {
    return std::string("<D:href>") + apr_xml_quote_string(r->pool, urlPath.c_str(), 0) + "</D:href>";
}

} // namespace

std::string hrefElement(request_rec* r, const std::string& path) {
    return hrefTo(r, escapedPath(r, path));
}

std::string hrefOf(request_rec* r, const Configuration& c, const TreePath& place) {
    return hrefTo(r, urlPathOf(r, c, place));
}

std::string urlPathOf(request_rec* r, const Configuration& c, const TreePath& place) {
    std::string path = c.base;
    if (!place.isBase()) path += "/" + place.owner;
    if (!place.below.empty()) path += "/" + place.tree();
    if (place.levels() <= c.levels()) path += "/";
    return escapedPath(r, path);
}

int refuse(request_rec* r, const Configuration& c, const Missing& missing) {
    if (!r->user && ap_auth_type(r)) {
        ap_note_auth_failure(r);
        return HTTP_UNAUTHORIZED;
    }
    const std::string children = "<D:resource>" + hrefOf(r, c, missing.place) +
                                 "<D:privilege><D:" + privilegeName(missing.privilege) +
                                 "/></D:privilege></D:resource>";
    const char* what = apr_psprintf(r->pool, "%s may not %s: the privilege %s is missing.",
                                    r->user ? r->user : "Nobody", r->method, privilegeName(missing.privilege));
    dav_error* error = dav_new_error_tag(r->pool, HTTP_FORBIDDEN, 0, 0, apr_xml_quote_string(r->pool, what, 0),
                                         "DAV:", "need-privileges");
    error->childtags = apr_pstrdup(r->pool, children.c_str());
    ap_log_rerror(APLOG_MARK, APLOG_INFO, 0, r, "davacl: %s (%s)", what, r->uri);
    r->status = HTTP_FORBIDDEN;
    boundUpload(r);
    ap_discard_request_body(r);
    return dav_handle_err(r, error, nullptr);
}

} // namespace rolvane::davacl
