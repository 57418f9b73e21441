#pragma once

#include "server/mod_davacl/Httpd.h"

namespace rolvane::davacl {

// The properties of RFC 3744 section 5 on everything below the base. They are no part of "allprop".
extern const dav_liveprop_group kLiveProperties;
int findLiveProperty(const dav_resource* resource, const char* space, const char* name,
                     const dav_hooks_liveprop** hooks) noexcept;
void insertAllLiveProperties(request_rec* r, const dav_resource* resource, dav_prop_insert what,
                             apr_text_header* text) noexcept;

// OPTIONS: "access-control" in the DAV header, ACL among the methods.
extern const dav_options_provider kOptions;

} // namespace rolvane::davacl
