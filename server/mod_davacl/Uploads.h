#pragma once

#include "server/mod_davacl/Httpd.h"

namespace rolvane::davacl {

// A client that sends the body of a request slowly holds a thread of httpd meanwhile. So DavAclUploadsOfUser bounds how
// many requests of one user wait for bytes of their bodies at a time, in each process of httpd: one more ends with 408.
// And for the body of a request that was refused before anybody had signed in nobody waits: its connection is closed.
// Any thread.
void registerUploads() noexcept;
// Bounds the request, whose user is known. Hook insert_filter; also before the body of a refused request is thrown
// away.
void boundUpload(request_rec* r) noexcept;
void leaveRefusedBody(request_rec* r) noexcept; // hook insert_error_filter

} // namespace rolvane::davacl
