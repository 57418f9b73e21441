#include "server/mod_davacl/TreeDirectories.h"

#include "server/mod_davacl/TreePath.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <shared_mutex>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <unixd.h>
#include <vector>

namespace rolvane::davacl {
namespace {

// A URL path of a host and the directory that is served there.
struct Mapping {
    const server_rec* server;
    std::string url, directory;
};

struct Guarded {
    std::shared_mutex mutex;
    std::vector<std::string> directories;
    std::vector<Mapping> ownPlaces; // below a base, served by an Alias of their own
};

// Lives as long as the process: other threads may still ask when it ends.
Guarded& guarded() {
    static auto* all = new Guarded;
    return *all;
}

std::string withoutSlash(std::string path) {
    while (path.size() > 1 && path.back() == '/') path.pop_back();
    return path;
}

bool isWithin(std::string_view path, std::string_view directory) {
    if (directory == "/") return path.starts_with('/');
    return path.starts_with(directory) && (path.size() == directory.size() || path[directory.size()] == '/');
}

bool touches(std::string_view one, std::string_view other) {
    return isWithin(one, other) || isWithin(other, one);
}

std::string withoutLinks(const std::string& path) {
    char* real = realpath(path.c_str(), nullptr);
    const std::string result = real ? real : path;
    std::free(real);
    return result;
}

void guard(const std::string& directory) {
    Guarded& all = guarded();
    const std::unique_lock lock(all.mutex);
    if (std::find(all.directories.begin(), all.directories.end(), directory) == all.directories.end())
        all.directories.push_back(directory);
}

bool isDirectory(const std::string& path) {
    struct stat info {};
    return stat(path.c_str(), &info) == 0 && S_ISDIR(info.st_mode);
}

bool isGuarded(const std::string& directory) {
    Guarded& all = guarded();
    const std::shared_lock lock(all.mutex);
    return std::find(all.directories.begin(), all.directories.end(), directory) != all.directories.end();
}

// The directory of the Alias that serves a URL path below a base; "" where that of the base does.
std::string ownDirectoryOf(std::string_view uri) {
    Guarded& all = guarded();
    const std::shared_lock lock(all.mutex);
    const auto found = std::find_if(all.ownPlaces.begin(), all.ownPlaces.end(),
                                    [&](const Mapping& place) { return isWithin(uri, place.url); });
    return found == all.ownPlaces.end() ? std::string() : found->directory;
}

// The virtual host whose section a directive stands in; the main server when it stands in none.
const server_rec* hostOf(const ap_directive_t* directive, const server_rec* main) {
    for (const ap_directive_t* up = directive->parent; up; up = up->parent) {
        if (strcasecmp(up->directive, "<VirtualHost") != 0) continue;
        for (const server_rec* each = main; each; each = each->next)
            if (each->defn_name && std::strcmp(each->defn_name, up->filename) == 0 &&
                each->defn_line_number == static_cast<unsigned>(up->line_num))
                return each;
    }
    return main;
}

void addAliases(const ap_directive_t* directive, apr_pool_t* pool, const server_rec* main, std::vector<Mapping>& into) {
    for (; directive; directive = directive->next) {
        addAliases(directive->first_child, pool, main, into);
        if (strcasecmp(directive->directive, "Alias") != 0 && strcasecmp(directive->directive, "ScriptAlias") != 0)
            continue;
        const char* arguments = directive->args;
        const std::string url = ap_getword_conf(pool, &arguments);
        const char* directory = ap_getword_conf(pool, &arguments);
        if (!*directory) continue; // within a <Location>, whose path is not told here
        const char* whole = ap_server_root_relative(pool, directory);
        if (whole) into.push_back({hostOf(directive, main), withoutSlash(url), withoutSlash(whole)});
    }
}

const Configuration* configurationOf(const server_rec* server) {
    const auto* c = static_cast<const Configuration*>(ap_get_module_config(server->module_config, &davacl_module));
    return c && c->base ? c : nullptr;
}

// Where a host's trees lie; "" when nothing tells.
std::string directoryOf(const server_rec* server, const server_rec* main, const Configuration& c,
                        const std::vector<Mapping>& aliases) {
    for (const server_rec* host : {server, main})
        for (const Mapping& each : aliases)
            if (each.server == host && isWithin(c.base, each.url))
                return each.directory + std::string(c.base).substr(each.url == "/" ? 0 : each.url.size());
    const auto* core = static_cast<const core_server_config*>(ap_get_core_module_config(server->module_config));
    return core->ap_document_root ? withoutSlash(core->ap_document_root) + c.base : std::string();
}

std::string nameOf(const server_rec* server) {
    return server->server_hostname ? server->server_hostname : "the main server";
}

uid_t httpdsUser() {
    return geteuid() == 0 ? ap_unixd_config.user_id : geteuid();
}

const char* complaintAboutLists(apr_pool_t* pool, const Configuration& c) {
    struct stat info {};
    const bool usable = stat(c.lists, &info) == 0 && info.st_uid == httpdsUser() && (info.st_mode & 0700) == 0700;
    return usable ? nullptr
                  : apr_psprintf(pool,
                                 "the directory of the access lists, %s, does not belong to the user that httpd runs "
                                 "as, or that user may not write there: no list could be set",
                                 c.lists);
}

// Another URL or host that leads to the directory. The module refuses what comes that way, as far as its name tells.
const char* complaintAboutWay(apr_pool_t* pool, const server_rec* main, const Mapping& way,
                              const std::string& directory) {
    const std::string real = withoutLinks(way.directory), place = withoutLinks(directory);
    if (!touches(real, place)) return nullptr;
    if (!touches(way.directory, directory) && !touches(way.directory, place))
        return apr_psprintf(
            pool,
            "%s of %s leads through the symbolic link %s to %s, which access lists guard: take it away, "
            "or name the directory itself",
            way.url.c_str(), nameOf(way.server).c_str(), way.directory.c_str(), directory.c_str());
    ap_log_error(APLOG_MARK, APLOG_STARTUP | APLOG_WARNING, 0, main,
                 "davacl: %s is also reached as %s of %s: what comes that way is refused", directory.c_str(),
                 way.url.c_str(), nameOf(way.server).c_str());
    return nullptr;
}

bool isBaseItself(const Mapping& way, const Configuration& c, const std::string& directory) {
    const Configuration* there = configurationOf(way.server);
    if (!there || std::strcmp(there->base, c.base) != 0 || !isWithin(c.base, way.url)) return false;
    return way.directory + std::string(c.base).substr(way.url == "/" ? 0 : way.url.size()) == directory;
}

} // namespace

const char* findDirectories(apr_pool_t* pool, server_rec* main) {
    std::vector<Mapping> ways;
    addAliases(ap_conftree, pool, main, ways);
    const std::vector<Mapping> aliases = ways;
    for (const server_rec* each = main; each; each = each->next) {
        const auto* core = static_cast<const core_server_config*>(ap_get_core_module_config(each->module_config));
        if (core->ap_document_root) ways.push_back({each, "/", withoutSlash(core->ap_document_root)});
    }
    std::vector<std::pair<std::string, const Configuration*>> trees;
    const char* worst = nullptr;
    const auto complain = [&](const char* complaint) { worst = worst ? worst : complaint; };
    {
        Guarded& all = guarded();
        const std::unique_lock lock(all.mutex);
        all.directories.clear();
        all.ownPlaces.clear();
        for (const server_rec* each = main; each; each = each->next)
            for (const Mapping& alias : aliases)
                if (const Configuration* c = configurationOf(each);
                    c && alias.url != c->base && isWithin(alias.url, c->base))
                    all.ownPlaces.push_back(alias);
    }
    for (const server_rec* each = main; each; each = each->next) {
        const Configuration* c = configurationOf(each);
        if (!c) continue;
        const std::string directory = directoryOf(each, main, *c, aliases);
        guard(withoutSlash(c->lists));
        guard(withoutLinks(c->lists));
        complain(complaintAboutLists(pool, *c));
        for (const auto& [other, others] : trees)
            if (!directory.empty() && touches(withoutLinks(directory), withoutLinks(other)) &&
                (std::strcmp(others->lists, c->lists) != 0 || withoutLinks(directory) != withoutLinks(other)))
                complain(apr_psprintf(pool,
                                      "two hosts serve the same trees, those in %s, under different lists, %s and %s",
                                      directory.c_str(), others->lists, c->lists));
        if (directory.empty()) continue;
        trees.emplace_back(directory, c);
        guard(directory);
        guard(withoutLinks(directory));
        for (const Mapping& way : ways)
            if (!isBaseItself(way, *c, directory)) complain(complaintAboutWay(pool, main, way, directory));
    }
    return worst;
}

// The site may have pages of its own below the base. What is served there without WebDAV is no tree, and an Alias tells
// nothing of the trees beside it: guarding what is around the page would shut the site.
void learnDirectory(request_rec* r, const Configuration& c) {
    if (!r->filename || r->filename[0] != '/' || r->proxyreq != PROXYREQ_NONE || !dav_get_provider(r)) return;
    std::string directory = ownDirectoryOf(r->uri);
    if (directory.empty()) {
        const std::string rest = withoutSlash(r->uri + std::strlen(c.base));
        const std::string file = withoutSlash(std::string(r->filename) + (r->path_info ? r->path_info : ""));
        if (rest.size() < 2 || file.size() <= rest.size() || !file.ends_with(rest)) return;
        directory = file.substr(0, file.size() - rest.size());
    }
    // Where the directory's name comes out of the request, as that of its host, only one that is there counts.
    if (!isGuarded(directory) && isDirectory(directory)) guard(directory);
}

bool isOfATree(const request_rec* r) {
    if (!r->filename || r->filename[0] != '/') return false;
    const std::string_view file = r->filename;
    Guarded& all = guarded();
    const std::shared_lock lock(all.mutex);
    const bool found = std::any_of(all.directories.begin(), all.directories.end(),
                                   [&](const std::string& directory) { return isWithin(file, directory); });
    if (found)
        ap_log_rerror(APLOG_MARK, APLOG_INFO, 0, r, "davacl: %s is guarded by access lists, and not served as %s",
                      r->filename, r->uri);
    return found;
}

} // namespace rolvane::davacl
