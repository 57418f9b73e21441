#pragma once

#include "server/mod_cardbook/Httpd.h"

namespace rolvane::cardbook {

// A hook of mod_dav: addressbook-multiget, addressbook-query (RFC 6352 sections 8.6 and 8.7) and sync-collection (RFC
// 6578) on books.
int deliverReport(request_rec* r, const dav_resource* resource, const apr_xml_doc* doc, ap_filter_t* output,
                  dav_error** error) noexcept;

} // namespace rolvane::cardbook
