#pragma once

#include "server/mod_davacl/Httpd.h"

namespace rolvane::davacl {

// Connections on which nobody has signed in yet, and their bound for each address (DavAclNewcomers). Whoever may
// connect can hold connections; when one address holds more than the bound in a process of httpd, those of it that have
// been silent longest are closed, once a second (NewcomerBound.h). One that is being answered, that has just said
// something or whose bytes wait to be read is never closed, and once somebody has signed in on a connection it counts
// no more.
//
// An address is four bytes of IPv4, or the eight of IPv6 that a network gets. Any thread.
int noteConnection(conn_rec* c) noexcept; // hook process_connection: a new one, or one that says something
int noteRequest(request_rec* r) noexcept; // hook post_read_request: it is being answered
int noteSignIn(request_rec* r) noexcept;  // hook fixups
int noteAnswer(request_rec* r) noexcept;  // hook log_transaction: it is answered
void watchNewcomers(apr_pool_t* pool, server_rec* server) noexcept; // hook child_init: a thread of its own

} // namespace rolvane::davacl
