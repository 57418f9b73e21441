#pragma once

#include "server/mod_davacl/Configuration.h"

namespace rolvane::davacl {

// Requests that wait for news of trees, as docs/mod_davacl.md describes: the report "news", whose answer is a stream of
// lines that ends when the right, the password, the time or the process does. A waiting request holds no thread.
//
// httpd has no call that gives a suspended connection back to its MPM. So a waiting connection ends with its answer.

std::string newsReportElement(); // of DAV:supported-report-set
// What the hook of mod_dav returns for that report. After OK the request waits, and its handler must return what
// `handedOver` makes of its answer.
int waitForNews(request_rec* r, const Configuration& c, const apr_xml_doc* doc, dav_error** error);
int handedOver(request_rec* r, int answer); // SUSPENDED for a request that waits, else the answer

// Hooks of httpd.
void startWaiting(apr_pool_t* pool, server_rec* server) noexcept; // child_init
void noteSuspended(conn_rec* c, request_rec* r) noexcept;         // suspend_connection
void endWaiting(apr_pool_t* pool, int graceful) noexcept;         // child_stopping

} // namespace rolvane::davacl
