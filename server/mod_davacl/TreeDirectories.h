#pragma once

#include "server/mod_davacl/Configuration.h"

namespace rolvane::davacl {

// Which directories hold the trees and the lists of all virtual hosts. Their files are served at the base of a host and
// nowhere else. Known from Alias and DocumentRoot when the configuration is read, and from requests below the base.
// Any thread.

// Looks for ways around the lists. Warns of those that the module closes. A complaint about the first one that it
// cannot close, or null.
const char* findDirectories(apr_pool_t* pool, server_rec* server);
// The directory behind the base, told by a request below it.
void learnDirectory(request_rec* r, const Configuration& c);
// Whether a request that is not below a base would be answered from one of these directories.
bool isOfATree(const request_rec* r);

} // namespace rolvane::davacl
