#include "server/mod_davacl/Configuration.h"

#include "server/mod_davacl/Confinement.h"
#include "server/mod_davacl/News.h"
#include "server/mod_davacl/Passwords.h"
#include "server/mod_davacl/QuotaTurn.h"
#include "server/mod_davacl/TreeDirectories.h"
#include "server/mod_davacl/TreePath.h"

#include <cstring>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

namespace rolvane::davacl {
namespace {

Configuration* ofServer(const server_rec* server) {
    return static_cast<Configuration*>(ap_get_module_config(server->module_config, &davacl_module));
}

// A URL path as a directive may name it, without the slash at its end; null when it is none.
const char* urlPath(cmd_parms* cmd, const char* given) {
    if (given[0] != '/') return nullptr;
    char* path = apr_pstrdup(cmd->pool, given);
    const size_t length = std::strlen(path);
    if (length > 1 && path[length - 1] == '/') path[length - 1] = '\0';
    char* clean = apr_pstrdup(cmd->pool, path);
    ap_no2slash(clean);
    ap_getparents(clean);
    const bool usable = std::strcmp(clean, path) == 0 && path[1] != '\0' && !std::strpbrk(path, "?#%");
    return usable ? path : nullptr;
}

const char* checkDirectory(cmd_parms* cmd, const char* what, const char* path) {
    struct stat info {};
    if (stat(path, &info) != 0 || !S_ISDIR(info.st_mode))
        return apr_pstrcat(cmd->pool, "the directory of the ", what, ", ", path,
                           ", is not there: make it, with mode 0700 and the user that httpd runs as for its owner",
                           nullptr);
    if (info.st_mode & (S_IWGRP | S_IWOTH))
        return apr_pstrcat(cmd->pool, "the directory of the ", what, ", ", path,
                           ", may be written by others: give it mode 0700", nullptr);
    return nullptr;
}

const char* setBase(cmd_parms* cmd, void*, const char* base, const char* lists) {
    Configuration* c = ofServer(cmd->server);
    if (c->base) return "DavAclBase may stand once in a virtual host";
    c->base = urlPath(cmd, base);
    if (!c->base) return "the base must be a URL path below the root, such as /dav, without escapes, \"..\" or \"//\"";
    c->lists = ap_server_root_relative(cmd->pool, lists);
    if (!c->lists) return "the second argument must be the directory of the access lists";
    return checkDirectory(cmd, "access lists", c->lists);
}

const char* setPrincipals(cmd_parms* cmd, void*, const char* path) {
    Configuration* c = ofServer(cmd->server);
    c->principals = urlPath(cmd, path);
    return c->principals ? nullptr
                         : "the place of the principals must be a URL path below the root, such as /principals";
}

const char* setGroupFile(cmd_parms* cmd, void*, const char* path) {
    Configuration* c = ofServer(cmd->server);
    c->groupFile = ap_server_root_relative(cmd->pool, path);
    return c->groupFile ? nullptr : "the argument must be the path of a group file";
}

const char* setUserFile(cmd_parms* cmd, void*, const char* path) {
    Configuration* c = ofServer(cmd->server);
    c->userFile = ap_server_root_relative(cmd->pool, path);
    return c->userFile ? nullptr : "the argument must be the path of a password file";
}

const char* setLastUse(cmd_parms* cmd, void*, const char* path) {
    Configuration* c = ofServer(cmd->server);
    c->lastUse = ap_server_root_relative(cmd->pool, path);
    return c->lastUse ? nullptr : "the argument must be the path of a directory";
}

const char* setOwnPasswords(cmd_parms* cmd, void*, const char* path) {
    Configuration* c = ofServer(cmd->server);
    c->ownPasswords = ap_server_root_relative(cmd->pool, path);
    if (!c->ownPasswords) return "the argument must be the path of a directory";
    return checkDirectory(cmd, "users' own passwords", c->ownPasswords);
}

const char* addUsers(cmd_parms* cmd, void*, const char* provider) {
    Configuration* c = ofServer(cmd->server);
    if (!ap_lookup_provider(AUTHN_PROVIDER_GROUP, provider, AUTHN_PROVIDER_VERSION))
        return apr_pstrcat(cmd->pool, "there is no authentication provider called ", provider,
                           ": load its module before this line", nullptr);
    if (!c->users) c->users = apr_array_make(cmd->pool, 2, sizeof(const char*));
    *static_cast<const char**>(apr_array_push(c->users)) = apr_pstrdup(cmd->pool, provider);
    return nullptr;
}

// False when the text is no number from 1 to `most`.
bool readNumber(const char* text, int most, int& into) {
    char* end = nullptr;
    const apr_int64_t number = apr_strtoi64(text, &end, 10);
    if (end == text || *end || number < 1 || number > most) return false;
    into = static_cast<int>(number);
    return true;
}

const char* setDepth(cmd_parms* cmd, void*, const char* text) {
    return readNumber(text, 8, ofServer(cmd->server)->depth) ? nullptr : "the depth must be a number from 1 to 8";
}

const char* setMaxEntries(cmd_parms* cmd, void*, const char* text) {
    return readNumber(text, 100000, ofServer(cmd->server)->entries) ? nullptr
                                                                    : "the number of entries must be from 1 to 100000";
}

const char* setStrict(cmd_parms* cmd, void*, int on) {
    ofServer(cmd->server)->strict = on;
    return nullptr;
}

const char* setParks(cmd_parms* cmd, void*, int on) {
    ofServer(cmd->server)->parks = on;
    return nullptr;
}

const char* setSlows(cmd_parms* cmd, void*, int on) {
    ofServer(cmd->server)->slows = on;
    return nullptr;
}

// 0, or a number up to 100,000.
bool readBound(const char* text, int& into) {
    if (std::strcmp(text, "0") != 0) return readNumber(text, 100000, into);
    into = 0;
    return true;
}

const char* setNewcomers(cmd_parms* cmd, void*, const char* text) {
    return readBound(text, ofServer(cmd->server)->newcomers) ? nullptr
                                                             : "the number of connections must be from 0 to 100000";
}

const char* setUploads(cmd_parms* cmd, void*, const char* text) {
    return readBound(text, ofServer(cmd->server)->uploads) ? nullptr
                                                           : "the number of requests must be from 0 to 100000";
}

const char* setSlowThreads(cmd_parms* cmd, void*, const char* text) {
    return readBound(text, ofServer(cmd->server)->slowThreads) ? nullptr
                                                               : "the number of threads must be from 0 to 100000";
}

const char* setNews(cmd_parms* cmd, void*, int on) {
    ofServer(cmd->server)->news = on;
    return nullptr;
}

const char* setNewsOfUser(cmd_parms* cmd, void*, const char* text) {
    return readNumber(text, 10000, ofServer(cmd->server)->newsOfUser)
               ? nullptr
               : "the number of requests that wait must be from 1 to 10000";
}

const char* setQuota(cmd_parms* cmd, void*, const char* text) {
    const auto size = sizeOf(text);
    if (!size) return "the quota must be a number of bytes, such as 1048576, 500M or 2G, or none";
    ofServer(cmd->server)->quota = *size;
    ofServer(cmd->server)->hasQuota = true;
    return nullptr;
}

const char* setQuotaFile(cmd_parms* cmd, void*, const char* path) {
    Configuration* c = ofServer(cmd->server);
    c->quotaFile = ap_server_root_relative(cmd->pool, path);
    return c->quotaFile ? nullptr : "the argument must be the path of a file of quotas";
}

const char* setHeartbeat(cmd_parms* cmd, void*, const char* text) {
    return readNumber(text, 60, ofServer(cmd->server)->heartbeat) ? nullptr
                                                                  : "the heartbeat must be from 1 to 60 seconds";
}

// AP_INIT_* want the one type of function in a union that C++ will not convert to.
template <class Function>
cmd_func asCommand(Function function) {
    return reinterpret_cast<cmd_func>(reinterpret_cast<void (*)()>(function));
}

bool isWithin(const char* path, const char* directory) {
    const size_t length = std::strlen(directory);
    return std::strncmp(path, directory, length) == 0 && (path[length] == '/' || path[length] == '\0');
}

const char* complaintAbout(const server_rec* server) {
    const Configuration* c = ofServer(server);
    if (!c->base) {
        if (c->principals || c->groupFile || c->users || c->depth || c->entries || c->keepsQuotas())
            return "DavAclPrincipals, DavAclGroupFile, DavAclUsers, DavAclDepth, DavAclMaxEntries and DavAclQuota need "
                   "a "
                   "DavAclBase";
        return nullptr;
    }
    if (isWithin(c->base, c->principalBase()) || isWithin(c->principalBase(), c->base))
        return "the places of the trees and of the principals must not lie within each other: set DavAclPrincipals";
    const auto* core = static_cast<const core_server_config*>(ap_get_core_module_config(server->module_config));
    if (core->ap_document_root &&
        (isWithin(c->lists, core->ap_document_root) || isWithin(core->ap_document_root, c->lists)))
        return "the directory of the access lists and the DocumentRoot must not lie within each other";
    if (c->ownPasswords && core->ap_document_root &&
        (isWithin(c->ownPasswords, core->ap_document_root) || isWithin(core->ap_document_root, c->ownPasswords)))
        return "the directory of users' own passwords and the DocumentRoot must not lie within each other";
    return nullptr;
}

} // namespace

const Configuration* configurationOf(const request_rec* r) {
    const Configuration* c = ofServer(r->server);
    return c && c->base ? c : nullptr;
}

const char* userFileOf(const request_rec* r) {
    const Configuration* c = ofServer(r->server);
    return c ? c->userFile : nullptr;
}

bool slowsGuesses(const request_rec* r) {
    const Configuration* c = ofServer(r->server);
    return c && c->slows > 0;
}

const char* lastUseDirectoryOf(const request_rec* r) {
    const Configuration* c = ofServer(r->server);
    return c ? c->lastUse : nullptr;
}

const char* ownPasswordsOf(const request_rec* r) {
    const Configuration* c = ofServer(r->server);
    return c ? c->ownPasswords : nullptr;
}

int mostNewcomers(const server_rec* server) {
    const Configuration* c = ofServer(server);
    return c && c->newcomers > 0 ? c->newcomers : 0;
}

size_t uploadsOfUser(const server_rec* server) {
    const Configuration* c = ofServer(server);
    return c && c->uploads > 0 ? static_cast<size_t>(c->uploads) : 0;
}

size_t mostSlowThreads(const server_rec* server) {
    const Configuration* c = ofServer(server);
    return c && c->slowThreads > 0 ? static_cast<size_t>(c->slowThreads) : 0;
}

bool givesNews(const server_rec* server) {
    const Configuration* c = ofServer(server);
    return c && c->base && c->news > 0;
}

size_t newsOfUser(const Configuration& c) {
    constexpr size_t kUsual = 16; // computers and programs of one person
    return c.newsOfUser ? static_cast<size_t>(c.newsOfUser) : kUsual;
}

int newsHeartbeat(const Configuration& c) {
    constexpr int kUsual = 45; // proxies give up on an answer that stands still for a minute
    return c.heartbeat ? c.heartbeat : kUsual;
}

bool parksConnections(const server_rec* server) {
    const Configuration* c = ofServer(server);
    return c && c->parks > 0;
}

void* createConfiguration(apr_pool_t* pool, server_rec*) {
    return new (apr_palloc(pool, sizeof(Configuration))) Configuration;
}

void* mergeConfigurations(apr_pool_t* pool, void* base, void* more) {
    const auto* outer = static_cast<const Configuration*>(base);
    const auto* inner = static_cast<const Configuration*>(more);
    auto* merged = new (apr_palloc(pool, sizeof(Configuration))) Configuration(*outer);
    if (inner->base) {
        merged->base = inner->base;
        merged->lists = inner->lists;
    }
    if (inner->principals) merged->principals = inner->principals;
    if (inner->groupFile) merged->groupFile = inner->groupFile;
    if (inner->users) merged->users = inner->users;
    if (inner->userFile) merged->userFile = inner->userFile;
    if (inner->lastUse) merged->lastUse = inner->lastUse;
    if (inner->ownPasswords) merged->ownPasswords = inner->ownPasswords;
    if (inner->slows >= 0) merged->slows = inner->slows;
    if (inner->strict >= 0) merged->strict = inner->strict;
    if (inner->parks >= 0) merged->parks = inner->parks;
    if (inner->newcomers >= 0) merged->newcomers = inner->newcomers;
    if (inner->uploads >= 0) merged->uploads = inner->uploads;
    if (inner->slowThreads >= 0) merged->slowThreads = inner->slowThreads;
    if (inner->news >= 0) merged->news = inner->news;
    if (inner->newsOfUser) merged->newsOfUser = inner->newsOfUser;
    if (inner->heartbeat) merged->heartbeat = inner->heartbeat;
    if (inner->depth) merged->depth = inner->depth;
    if (inner->hasQuota) merged->quota = inner->quota;
    merged->hasQuota = outer->hasQuota || inner->hasQuota;
    if (inner->quotaFile) merged->quotaFile = inner->quotaFile;
    if (inner->entries) merged->entries = inner->entries;
    return merged;
}

namespace {

bool isSection(const ap_directive_t* directive, const char* name) {
    return directive && strcasecmp(directive->directive, name) == 0;
}

// The argument of a section, "</dav>" for instance, without quotation marks and the closing bracket.
std::string placeOf(const ap_directive_t* section) {
    std::string place = section->args ? section->args : "";
    std::erase_if(place, [](char c) { return c == '"' || c == '>'; });
    while (place.size() > 1 && (place.back() == '/' || place.back() == ' ')) place.pop_back();
    return place;
}

// Where "Dav On" holds for the directory or URL path of a section, and that lies above the trees.
bool liesAbove(const ap_directive_t* section, const Configuration& c, const char* documentRoot) {
    if (isSection(section, "<Location")) return isAbove(c.base, placeOf(section)) || placeOf(section) == "/";
    if (!isSection(section, "<Directory") || !documentRoot) return false;
    return isAbove(std::string(documentRoot) + c.base, placeOf(section));
}

void warnAboutDavAbove(const ap_directive_t* directive, const server_rec* server, const Configuration& c) {
    const auto* core = static_cast<const core_server_config*>(ap_get_core_module_config(server->module_config));
    for (; directive; directive = directive->next) {
        if (strcasecmp(directive->directive, "Dav") == 0 && directive->args &&
            strcasecmp(directive->args, "off") != 0 &&
            (!directive->parent || isSection(directive->parent, "<VirtualHost") ||
             liesAbove(directive->parent, c, core->ap_document_root)))
            ap_log_error(APLOG_MARK, APLOG_STARTUP | APLOG_WARNING, 0, server,
                         "davacl: WebDAV is on above the trees at %s (%s, line %d): switch it on at %s and below only",
                         c.base, directive->filename, directive->line_num, c.base);
        warnAboutDavAbove(directive->first_child, server, c);
    }
}

int checkDirectives(const server_rec* server) {
    for (; server; server = server->next)
        if (const char* complaint = complaintAbout(server)) {
            ap_log_error(APLOG_MARK, APLOG_STARTUP | APLOG_ERR, 0, server, "davacl: %s", complaint);
            return HTTP_INTERNAL_SERVER_ERROR;
        }
    return OK;
}

} // namespace

int checkConfigurations(apr_pool_t* pool, apr_pool_t*, apr_pool_t* temporary, server_rec* main) {
    if (ap_state_query(AP_SQ_MAIN_STATE) == AP_SQ_MS_CREATE_PRE_CONFIG) return checkDirectives(main);
    if (const int answer = checkDirectives(main); answer != OK) return answer;
    const char* complaint = prepareConfinement(pool, temporary, main);
    if (!complaint) complaint = preparePasswords(pool);
    if (!complaint) complaint = prepareNews(main);
    prepareQuotas();
    bool strict = complaint;
    if (!complaint) complaint = findDirectories(pool, main);
    for (const server_rec* each = main; each; each = each->next) {
        if (!ofServer(each)->base) continue;
        warnAboutDavAbove(ap_conftree, each, *ofServer(each));
        strict = strict || ofServer(each)->isStrict();
    }
    if (!complaint) return OK;
    ap_log_error(APLOG_MARK, APLOG_STARTUP | (strict ? APLOG_ERR : APLOG_WARNING), 0, main, "davacl: %s%s", complaint,
                 strict ? " (with DavAclStrict Off httpd would start all the same)" : "");
    return strict ? HTTP_INTERNAL_SERVER_ERROR : OK;
}

const command_rec kDirectives[] = {
    {"DavAclBase", asCommand(setBase), nullptr, RSRC_CONF, TAKE2,
     "the URL path whose first segments name the trees' owners, and the directory of their lists"},
    {"DavAclPrincipals", asCommand(setPrincipals), nullptr, RSRC_CONF, TAKE1,
     "the URL path of the principals, /principals by default"},
    {"DavAclGroupFile", asCommand(setGroupFile), nullptr, RSRC_CONF, TAKE1, "a group file, as for AuthGroupFile"},
    {"DavAclUsers", asCommand(addUsers), nullptr, RSRC_CONF, ITERATE,
     "authentication providers that know which users exist"},
    {"DavAclUserFile", asCommand(setUserFile), nullptr, RSRC_CONF, TAKE1,
     "a file with a line for each user, which begins with the name and a colon, such as AuthUserFile names"},
    {"DavAclStrict", asCommand(setStrict), nullptr, RSRC_CONF, FLAG,
     "whether a way around the lists that cannot be closed keeps httpd from starting: On by default"},
    {"DavAclParkConnections", asCommand(setParks), nullptr, RSRC_CONF, FLAG,
     "whether connections that say nothing wait without a thread: Off by default"},
    {"DavAclSlowGuesses", asCommand(setSlows), nullptr, RSRC_CONF, FLAG,
     "whether passwords are not looked at for a while after wrong ones from the same address: Off by default"},
    {"DavAclLastUse", asCommand(setLastUse), nullptr, RSRC_CONF, TAKE1,
     "a directory in which the date of the file with a user's name tells when that user signed in last"},
    {"DavAclOwnPasswords", asCommand(setOwnPasswords), nullptr, RSRC_CONF, TAKE1,
     "a directory for the passwords that users choose themselves; without it they cannot"},
    {"DavAclUploadsOfUser", asCommand(setUploads), nullptr, RSRC_CONF, TAKE1,
     "how many requests of one user may wait for bytes of their bodies in each process"},
    {"DavAclSlowThreads", asCommand(setSlowThreads), nullptr, RSRC_CONF, TAKE1,
     "how many threads of each process may wait for a second for clients' networks: 0, no bound, by default"},
    {"DavAclNewcomers", asCommand(setNewcomers), nullptr, RSRC_CONF, TAKE1,
     "how many connections of one address, in one process, may be silent without a sign-in: 0, no bound, by default"},
    {"DavAclNews", asCommand(setNews), nullptr, RSRC_CONF, FLAG,
     "whether readers may wait for news of the trees, without a thread: Off by default"},
    {"DavAclNewsOfUser", asCommand(setNewsOfUser), nullptr, RSRC_CONF, TAKE1,
     "how many requests of one user, in one process, may wait for news: 16 by default"},
    {"DavAclNewsHeartbeat", asCommand(setHeartbeat), nullptr, RSRC_CONF, TAKE1,
     "after how many seconds without news a waiting request gets a line all the same: 45 by default"},
    {"DavAclMaxEntries", asCommand(setMaxEntries), nullptr, RSRC_CONF, TAKE1,
     "how many entries a list may hold: 1000 by default"},
    {"DavAclQuota", asCommand(setQuota), nullptr, RSRC_CONF, TAKE1,
     "how many bytes each owner's tree may take: 500M, 2G, or none"},
    {"DavAclQuotaFile", asCommand(setQuotaFile), nullptr, RSRC_CONF, TAKE1,
     "a file with a line for each user who may have another quota: the name, a colon, and the size"},
    {"DavAclDepth", asCommand(setDepth), nullptr, RSRC_CONF, TAKE1,
     "how many segments below the base may have lists of their own: 2 by default"},
    {nullptr, nullptr, nullptr, 0, RAW_ARGS, nullptr}};

} // namespace rolvane::davacl
