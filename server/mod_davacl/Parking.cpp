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

constexpr const char* kGiveBack = "DAVACL-HEAD";

// The part of a connection's next head that was read. It is kept here, because behind a TLS record that is only looked
// at the next one is not seen, and its bytes may have left the socket already: the connection would wait for what is
// here. The filter kGiveBack, once it is in, gives it to whoever reads.
struct Head {
    char* text = nullptr; // kLongestHead bytes of the connection's pool
    size_t at = 0, end = 0;
    ap_filter_t* filter = nullptr;

    std::string_view rest() const { return {text + at, end - at}; }
    bool isEmpty() const { return at == end; }
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

// Reads what is here, at most as much as a head may have. EAGAIN when more may come.
apr_status_t readMore(conn_rec* c, Head& head) {
    apr_bucket_brigade* brigade = apr_brigade_create(c->pool, c->bucket_alloc);
    apr_status_t status = APR_SUCCESS;
    while (status == APR_SUCCESS && head.end < kLongestHead) {
        status = ap_get_brigade(head.filter->next, brigade, AP_MODE_READBYTES, APR_NONBLOCK_READ,
                                static_cast<apr_off_t>(kLongestHead - head.end));
        apr_size_t count = kLongestHead - head.end;
        if (status == APR_SUCCESS) status = apr_brigade_flatten(brigade, head.text + head.end, &count);
        if (status == APR_SUCCESS && count == 0) status = APR_EAGAIN;
        if (status == APR_SUCCESS) head.end += count;
        apr_brigade_cleanup(brigade);
    }
    apr_brigade_destroy(brigade);
    return status;
}

int lookAtTLS(conn_rec* c, Head& head) {
    apr_bucket_brigade* brigade = apr_brigade_create(c->pool, c->bucket_alloc);
    const apr_status_t status = ap_get_brigade(c->input_filters, brigade, AP_MODE_INIT, APR_NONBLOCK_READ, 0);
    apr_brigade_destroy(brigade);
    if (status == kHandshakeWantsRead || APR_STATUS_IS_EAGAIN(status)) return park(c);
    if (status != APR_SUCCESS) return DECLINED;
    if (!head.filter) {
        head.text = static_cast<char*>(apr_palloc(c->pool, kLongestHead));
        head.filter = ap_add_input_filter(kGiveBack, &head, nullptr, c);
        if (!head.filter) return DECLINED;
    }
    if (head.isEmpty()) head.at = head.end = 0;
    const apr_status_t more = readMore(c, head);
    if ((more != APR_SUCCESS && !APR_STATUS_IS_EAGAIN(more)) || isWholeHead(head.rest())) return DECLINED;
    return head.end < kLongestHead ? park(c) : DECLINED;
}

apr_status_t giveBack(ap_filter_t* filter, apr_bucket_brigade* brigade, ap_input_mode_t mode, apr_read_type_e block,
                      apr_off_t wanted) noexcept {
    auto& head = *static_cast<Head*>(filter->ctx);
    if (mode == AP_MODE_EATCRLF)
        while (!head.isEmpty() && (head.text[head.at] == '\r' || head.text[head.at] == '\n')) ++head.at;
    if (mode == AP_MODE_INIT || head.isEmpty()) return ap_get_brigade(filter->next, brigade, mode, block, wanted);
    if (mode == AP_MODE_EATCRLF) return APR_SUCCESS;
    const std::string_view rest = head.rest();
    size_t count = rest.size();
    if (mode == AP_MODE_GETLINE)
        count = std::min(rest.find('\n'), rest.size() - 1) + 1; // a line that ends later is asked for again
    else if (mode != AP_MODE_EXHAUSTIVE && wanted >= 0)
        count = std::min(count, static_cast<size_t>(wanted));
    apr_bucket* bucket = apr_bucket_heap_create(rest.data(), count, nullptr, filter->c->bucket_alloc);
    APR_BRIGADE_INSERT_TAIL(brigade, bucket);
    if (mode != AP_MODE_SPECULATIVE) head.at += count;
    return APR_SUCCESS;
}

} // namespace

int parkSilent(conn_rec* c) noexcept {
    if (c->master || !c->cs || c->aborted || c->data_in_input_filters || !parksConnections(c->base_server))
        return DECLINED;
    if (std::strcmp(ap_get_protocol(c), AP_PROTOCOL_HTTP1) != 0) return DECLINED;
    static const bool able = canPark();
    if (!able) return DECLINED;
    if (!ap_ssl_conn_is_ssl(c)) return lookAtPlain(c);
    auto* head = static_cast<Head*>(ap_get_module_config(c->conn_config, &davacl_module));
    if (!head) {
        head = new (apr_palloc(c->pool, sizeof(Head))) Head;
        ap_set_module_config(c->conn_config, &davacl_module, head);
    }
    return lookAtTLS(c, *head);
}

void registerParking() {
    ap_register_input_filter(kGiveBack, giveBack, nullptr, AP_FTYPE_CONNECTION); // above mod_ssl's
}

} // namespace rolvane::davacl
