#pragma once

#include "server/mod_davacl/Configuration.h"

#include <string>

namespace rolvane::davacl {

// The reports of RFC 3744 section 9 and DAV:expand-property (RFC 3253 section 3.8). None tells anybody what PROPFIND
// would not tell, and each ends at a number of responses and bytes: DAV:number-of-matches-within-limits then.
//
// A hook of mod_dav, for everything below the base: OK when the report was sent, DECLINED when it is another one.
int reportOnTrees(request_rec* r, const dav_resource* resource, const apr_xml_doc* doc, ap_filter_t* output,
                  dav_error** error) noexcept;
// The same for the principals, whose existence and the user's name have been looked at.
int reportOnPrincipals(request_rec* r, const Configuration& c);

// The content of DAV:supported-report-set.
std::string supportedReports(bool ofTrees, bool ofCollections = false);

} // namespace rolvane::davacl
