#include "server/mod_cardbook/Multistatus.h"

#include "server/mod_cardbook/Place.h"
#include "server/mod_cardbook/XmlText.h"

#include <stdexcept>

namespace rolvane::cardbook {
namespace {

constexpr size_t kPiece = 64 << 10;

} // namespace

std::string statusLine(int status) {
    return std::string("<D:status>HTTP/1.1 ") + ap_get_status_line(status) + "</D:status>";
}

Multistatus::Multistatus(request_rec* r, ap_filter_t* output)
    : _r(r), _output(output), _brigade(apr_brigade_create(r->pool, r->connection->bucket_alloc)) {}

// Not finished: the client must not take what came for the whole.
Multistatus::~Multistatus() {
    if (_ended || !_begun) return;
    _r->connection->keepalive = AP_CONN_CLOSE;
    apr_bucket_alloc_t* buckets = _r->connection->bucket_alloc;
    APR_BRIGADE_INSERT_TAIL(_brigade, ap_bucket_error_create(HTTP_BAD_GATEWAY, nullptr, _r->pool, buckets));
    APR_BRIGADE_INSERT_TAIL(_brigade, apr_bucket_eos_create(buckets));
    ap_pass_brigade(_output, _brigade);
}

void Multistatus::add(const std::string& response) {
    if (!_begun) {
        _begun = true;
        _r->status = HTTP_MULTI_STATUS;
        ap_set_content_type(_r, "application/xml; charset=\"utf-8\"");
        _text = "<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<D:multistatus xmlns:D=\"DAV:\" "
                "xmlns:C=\"urn:ietf:params:xml:ns:carddav\">\n";
    }
    _text += response;
    if (_text.size() >= kPiece) send(false);
}

void Multistatus::addStatus(const std::string& path, int status, const std::string& error) {
    std::string text = "<D:response><D:href>";
    appendXml(text, escapedPath(path));
    text += "</D:href>" + statusLine(status);
    if (!error.empty()) text += "<D:error>" + error + "</D:error>";
    add(text + "</D:response>\n");
}

void Multistatus::finish() {
    add("</D:multistatus>\n");
    send(true);
    _ended = true;
}

void Multistatus::send(bool last) {
    apr_bucket_alloc_t* buckets = _r->connection->bucket_alloc;
    APR_BRIGADE_INSERT_TAIL(_brigade, apr_bucket_transient_create(_text.data(), _text.size(), buckets));
    if (last) APR_BRIGADE_INSERT_TAIL(_brigade, apr_bucket_eos_create(buckets));
    const apr_status_t passed = ap_pass_brigade(_output, _brigade);
    apr_brigade_cleanup(_brigade);
    _text.clear();
    if (passed != APR_SUCCESS || _r->connection->aborted) {
        _ended = true; // nobody listens any more
        throw std::runtime_error("the client has gone before the end of its answer");
    }
}

} // namespace rolvane::cardbook
