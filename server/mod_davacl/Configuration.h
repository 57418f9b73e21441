#pragma once

#include "server/mod_davacl/Httpd.h"
#include "server/mod_davacl/Quota.h"

namespace rolvane::davacl {

// What the directives of one virtual host say; in the configuration's pool. See docs/mod_davacl.md.
struct Configuration {
    const char* base = nullptr;          // without a slash at the end; null: the module does nothing here
    const char* lists = nullptr;         // the directory of the lists
    const char* principals = nullptr;    // without a slash at the end
    const char* groupFile = nullptr;     // null: no groups
    apr_array_header_t* users = nullptr; // of const char*: the authentication providers that know who exists
    const char* userFile = nullptr;      // null: none; who stands in it exists, and no provider is asked
    const char* lastUse = nullptr;       // a directory; null: nobody's last use is noted
    const char* ownPasswords = nullptr;  // a directory; null: users cannot change their passwords
    int entries = 0;                     // the most that a list holds
    int strict = -1;                     // whether a way around the lists keeps httpd from starting; -1: not said
    int parks = -1;                      // whether silent connections wait without a thread; -1: not said
    int slows = -1;                      // whether guesses of passwords are slowed down; -1: not said
    int newcomers = -1;                  // -1: not said
    int uploads = -1;                    // -1: not said
    int slowThreads = -1;                // -1: not said
    int news = -1;                       // whether readers may wait for news; -1: not said
    int newsOfUser = 0;                  // the most waiting requests of one user in a process; 0: not said
    int heartbeat = 0;                   // seconds between two lines; 0: not said
    uint64_t quota = kNoQuota;           // bytes that each owner's tree may take
    const char* quotaFile = nullptr;     // users' own quotas; null: none
    bool hasQuota = false;               // whether `quota` was said
    int depth = 0;                       // how many segments below the base may have lists of their own

    bool isStrict() const { return strict != 0; }
    bool keepsQuotas() const { return hasQuota || quotaFile; }
    const char* principalBase() const { return principals ? principals : "/principals"; }
    size_t mostEntries() const { return entries ? static_cast<size_t>(entries) : 1000; }
    size_t levels() const { return depth ? static_cast<size_t>(depth) : 2; }
};

// Null where no tree is under access lists.
const Configuration* configurationOf(const request_rec* r);

// DavAclUserFile's argument, with or without a base; null when there is none.
const char* userFileOf(const request_rec* r);
// DavAclSlowGuesses, and DavAclLastUse's argument (null when there is none).
bool slowsGuesses(const request_rec* r);
const char* lastUseDirectoryOf(const request_rec* r);
const char* ownPasswordsOf(const request_rec* r); // DavAclOwnPasswords' argument; null when there is none
// DavAclParkConnections, of the host that the connection came to.
bool parksConnections(const server_rec* server);
int mostNewcomers(const server_rec* server);      // 0: no bound
size_t uploadsOfUser(const server_rec* server);   // DavAclUploadsOfUser; 0: no bound
size_t mostSlowThreads(const server_rec* server); // DavAclSlowThreads; 0: no bound
bool givesNews(const server_rec* server);         // DavAclNews, where there is a base
size_t newsOfUser(const Configuration& c);        // DavAclNewsOfUser
int newsHeartbeat(const Configuration& c);        // seconds; DavAclNewsHeartbeat

void* createConfiguration(apr_pool_t* pool, server_rec* server);
void* mergeConfigurations(apr_pool_t* pool, void* base, void* more);
extern const command_rec kDirectives[];
// What can only be checked when everything has been read. OK, or DONE's opposite with a line in the log.
int checkConfigurations(apr_pool_t* pool, apr_pool_t* log, apr_pool_t* temporary, server_rec* server);

} // namespace rolvane::davacl
