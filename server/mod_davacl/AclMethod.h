#pragma once

#include "server/mod_davacl/Httpd.h"

namespace rolvane::davacl {

// The ACL method (RFC 3744 section 8). The answer comes when the list is durable, and when no request that the old list
// allowed can still change anything.
int serveAcl(request_rec* r) noexcept;
void registerAclMethod(apr_pool_t* pool);

} // namespace rolvane::davacl
