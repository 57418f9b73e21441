#pragma once

#include "server/mod_davacl/Httpd.h"

namespace rolvane::davacl {

// A thread of httpd waits where a client has connected and says nothing, so a few hundred silent strangers keep
// everybody out. With DavAclParkConnections a connection gets a thread when its TLS handshake is through and the head
// of a request is here; until then the MPM watches it, for as long as Timeout says. Under an MPM that cannot wait for
// input nothing changes.
int parkSilent(conn_rec* c) noexcept;
void registerParking();

} // namespace rolvane::davacl
