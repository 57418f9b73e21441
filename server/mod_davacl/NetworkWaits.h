#pragma once

#include "server/mod_davacl/Httpd.h"

namespace rolvane::davacl {

// The threads of one process of httpd that wait for clients' networks, those of HTTP/2's streams included, and their
// bound (DavAclSlowThreads; SlowThreads.h says who gives way). Each connection has a filter next to the network that
// notes when a thread goes in and comes out. Once a second the connections of the surplus are shut down, which wakes
// their threads; a stream of HTTP/2 takes its whole connection with it. In between, users with a full share are
// refused with 503. Any thread.
void registerNetworkWaits() noexcept;
int watchConnection(conn_rec* c, void* socket) noexcept;              // hook pre_connection
int endWatching(conn_rec* c) noexcept;                                // hook pre_close_connection
int beginRequest(request_rec* r) noexcept;                            // hook post_read_request
int boundSlowThreads(request_rec* r) noexcept;                        // hook fixups
void watchSlowThreads(apr_pool_t* pool, server_rec* server) noexcept; // hook child_init

} // namespace rolvane::davacl
