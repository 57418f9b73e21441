#pragma once

#include "store/http/CurlSlot.h"

#include <curl/curl.h>
#include <string>

namespace rolvane {

// What the transport decides from values alone.

// The one place where libcurl's codes become ours.
TransportError translated(CURLcode code);
// Whether a new connection may serve the job of the slot: a kept one has failed it, or the TLS handshake of a new one
// did, for the first time. The latter is safe for every method.
bool needsNewConnection(const CurlSlot& slot, CURLcode code);
// Why a transfer that ended with the code failed, for a person.
std::string reason(CURLcode code, const HttpJob& job);
// True when the answer asks for Digest and does not take Basic.
bool wantsDigest(const HttpResponse& answer);
// Why a request cannot be sent as it stands, or "".
std::string objection(const HttpJob& job);

} // namespace rolvane
