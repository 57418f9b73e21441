#include "store/http/CurlDecisions.h"

#include "store/account/Account.h"
#include "store/http/KeptConnections.h"

#include <string_view>
#include <strings.h>

namespace rolvane {

TransportError translated(CURLcode code) {
    switch (code) {
    case CURLE_OK: return TransportError::none;
    case CURLE_OPERATION_TIMEDOUT: return TransportError::timedOut;
    case CURLE_SSL_CONNECT_ERROR:
    case CURLE_PEER_FAILED_VERIFICATION:
    case CURLE_SSL_CERTPROBLEM:
    case CURLE_SSL_CIPHER:
    case CURLE_SSL_CACERT_BADFILE:
    case CURLE_SSL_ISSUER_ERROR:
    case CURLE_USE_SSL_FAILED: return TransportError::tls;
    case CURLE_FILESIZE_EXCEEDED: return TransportError::tooLarge;
    case CURLE_PARTIAL_FILE:
    case CURLE_WEIRD_SERVER_REPLY:
    case CURLE_BAD_CONTENT_ENCODING:
    case CURLE_UNSUPPORTED_PROTOCOL: return TransportError::truncated;
    case CURLE_URL_MALFORMAT: return TransportError::refused;
    default: return TransportError::unreachable;
    }
}

std::string reason(CURLcode code, const HttpJob& job) {
    const std::string* encoding = job.response.header("content-encoding");
    if (code == CURLE_BAD_CONTENT_ENCODING && encoding)
        return "The answer came encoded as \"" + *encoding + "\", which nobody asked for and which cannot be read.";
    return curl_easy_strerror(code);
}

bool wantsDigest(const HttpResponse& answer) {
    bool digest = false;
    for (const auto& [name, value] : answer.headers) {
        if (name != "www-authenticate") continue;
        if (strncasecmp(value.c_str(), "basic", 5) == 0) return false;
        digest = digest || strncasecmp(value.c_str(), "digest", 6) == 0;
    }
    return digest;
}

bool needsNewConnection(const CurlSlot& slot, CURLcode code) {
    const HttpJob& job = *slot.job();
    // The server ended the connection before there was one, so it has not seen a byte of the request.
    if (code == CURLE_SSL_CONNECT_ERROR && job.tries == 0 && job.verdict == TransportError::none)
        return !job.metNoHandshake;
    if (job.onNewConnection || job.verdict != TransportError::none || !mayBeSentTwice(job.request.method)) return false;
    const bool ended = job.metDead || code == CURLE_GOT_NOTHING || code == CURLE_SEND_ERROR ||
                       code == CURLE_RECV_ERROR || code == CURLE_HTTP2 || code == CURLE_HTTP2_STREAM ||
                       code == CURLE_PARTIAL_FILE;
    return ended && slot.metOnlyOldConnections();
}

std::string objection(const HttpJob& job) {
    if (job.origin.starts_with("http:")) {
        if (!isLoopbackHost(job.request.url.host()))
            return "Plain http is used on this machine only; " + job.origin + " needs https.";
    } else if (!job.origin.starts_with("https:")) {
        return "Only http and https can be sent.";
    }
    for (const auto& [name, value] : job.request.headers)
        if ((name + value).find_first_of(std::string_view("\r\n\0", 3)) != std::string::npos)
            return "A header of the request holds a line break.";
    return {};
}

} // namespace rolvane
