#include "server/mod_davacl/Parking.h"

#include "server/mod_davacl/Configuration.h"

#include <algorithm>
#include <ap_mpm.h>
#include <apr_portable.h>
#include <array>
#include <cerrno>
#include <cstring>
#include <http_connection.h>
#include <http_ssl.h>
#include <string>
#include <sys/socket.h>

namespace rolvane::davacl {
namespace {

// Longer heads than this are read by the thread that answers them.
constexpr size_t kLongestHead = 8000;
// What mod_ssl returns when the handshake waits for the client: OpenSSL's number, not one of APR's.
constexpr apr_status_t kHandshakeWantsRead = 2;

struct Seen {
    size_t bytes = 0; // of a head that is not whole yet
};

#ifdef AP_MPMQ_CAN_WAITIO
bool canPark() {
    int waits = 0;
    return ap_mpm_query(AP_MPMQ_CAN_WAITIO, &waits) == APR_SUCCESS && waits;
}

int park(conn_rec* c) {
    c->cs->state = CONN_STATE_ASYNC_WAITIO;
    c->cs->sense = CONN_SENSE_WANT_READ;
    return OK;
}
#else // an older httpd
bool canPark() {
    return false;
}

int park(conn_rec*) {
    return DECLINED;
}
#endif

// The empty line that ends a head; the preface of HTTP/2 has one, too.
bool isWholeHead(std::string_view text) {
    return text.size() >= kLongestHead || text.find("\r\n\r\n") != std::string_view::npos ||
           text.find("\n\n") != std::string_view::npos;
}

// The socket is readable again when it has more than these bytes.
void wakeAt(int socket, size_t bytes) {
    const int least = static_cast<int>(bytes);
    setsockopt(socket, SOL_SOCKET, SO_RCVLOWAT, &least, sizeof least);
}

int lookAtPlain(conn_rec* c) {
    apr_os_sock_t socket = -1;
    if (!ap_get_conn_socket(c) || apr_os_sock_get(&socket, ap_get_conn_socket(c)) != APR_SUCCESS) return DECLINED;
    std::array<char, kLongestHead> text{};
    const ssize_t count = recv(socket, text.data(), text.size(), MSG_PEEK | MSG_DONTWAIT);
    if (count == 0 || (count < 0 && errno != EAGAIN)) return DECLINED; // the end, which httpd finds by itself
    const auto size = static_cast<size_t>(std::max<ssize_t>(count, 0));
    if (isWholeHead({text.data(), size})) {
        wakeAt(socket, 1);
        return DECLINED;
    }
    wakeAt(socket, size + 1);
    return park(c);
}

std::string textOf(apr_bucket_brigade* brigade) {
    std::string text;
    for (apr_bucket* b = APR_BRIGADE_FIRST(brigade); b != APR_BRIGADE_SENTINEL(brigade); b = APR_BUCKET_NEXT(b)) {
        const char* part = nullptr;
        apr_size_t length = 0;
        if (!APR_BUCKET_IS_METADATA(b) && apr_bucket_read(b, &part, &length, APR_NONBLOCK_READ) == APR_SUCCESS)
            text.append(part, length);
    }
    return text;
}

int lookAtTLS(conn_rec* c, Seen& seen) {
    apr_bucket_brigade* brigade = apr_brigade_create(c->pool, c->bucket_alloc);
    apr_status_t status = ap_get_brigade(c->input_filters, brigade, AP_MODE_INIT, APR_NONBLOCK_READ, 0);
    if (status == kHandshakeWantsRead || APR_STATUS_IS_EAGAIN(status)) {
        apr_brigade_destroy(brigade);
        return park(c);
    }
    if (status != APR_SUCCESS) {
        apr_brigade_destroy(brigade);
        return DECLINED;
    }
    apr_brigade_cleanup(brigade);
    status = ap_get_brigade(c->input_filters, brigade, AP_MODE_SPECULATIVE, APR_NONBLOCK_READ, kLongestHead);
    const std::string text = status == APR_SUCCESS ? textOf(brigade) : std::string();
    apr_brigade_destroy(brigade);
    if (APR_STATUS_IS_EAGAIN(status) || (status == APR_SUCCESS && text.empty())) return park(c);
    if (status != APR_SUCCESS || isWholeHead(text)) return DECLINED;
    // A second record is not seen behind the first one: who sends a head in pieces waits once, and is read then.
    if (seen.bytes) return DECLINED;
    seen.bytes = text.size();
    return park(c);
}

} // namespace

int parkSilent(conn_rec* c) noexcept {
    if (c->master || !c->cs || c->aborted || c->data_in_input_filters || !parksConnections(c->base_server))
        return DECLINED;
    if (std::strcmp(ap_get_protocol(c), AP_PROTOCOL_HTTP1) != 0) return DECLINED;
    static const bool able = canPark();
    if (!able) return DECLINED;
    auto* seen = static_cast<Seen*>(ap_get_module_config(c->conn_config, &davacl_module));
    if (!seen) {
        seen = new (apr_palloc(c->pool, sizeof(Seen))) Seen;
        ap_set_module_config(c->conn_config, &davacl_module, seen);
    }
    const int answer = ap_ssl_conn_is_ssl(c) ? lookAtTLS(c, *seen) : lookAtPlain(c);
    if (answer == DECLINED) seen->bytes = 0;
    return answer;
}

} // namespace rolvane::davacl
