#pragma once

#include "server/mod_davacl/Httpd.h"

namespace rolvane::davacl {

// Below the base and the principals only mod_dav, this module and httpd's own sending of files answer. Other handlers
// stay out, whatever the rest of the configuration says. So do caches: no answer from there may be kept for anybody
// else.

// Reads the settings that hold there, once for a configuration. Nothing, or a complaint.
const char* prepareConfinement(apr_pool_t* pool, apr_pool_t* temporary, server_rec* server);
void registerConfinement() noexcept;
// When all sections that concern the request are joined: the settings come on top.
int confine(request_rec* r) noexcept;
// The same for the page of an error, for which httpd takes other filters away.
void confineError(request_rec* r) noexcept;
// In the place of all other handlers; never declines there.
int serveConfined(request_rec* r) noexcept;

} // namespace rolvane::davacl
