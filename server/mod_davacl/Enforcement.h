#pragma once

#include "server/mod_davacl/Httpd.h"

namespace rolvane::davacl {

// Every request and sub-request, whatever authorised it before: fixups run for all of them.
int enforce(request_rec* r) noexcept;
// The members that mod_dav walks to, which no hook of httpd sees: what may not be read is left out.
int enforceOnMember(request_rec* r, dav_resource* source, const dav_resource* member, const apr_xml_doc* body,
                    dav_error** error) noexcept;

} // namespace rolvane::davacl
