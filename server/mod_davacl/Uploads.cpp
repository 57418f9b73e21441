#include "server/mod_davacl/Uploads.h"

#include "server/mod_davacl/Configuration.h"

#include <mutex>
#include <string>
#include <unordered_map>

namespace rolvane::davacl {
namespace {

constexpr const char* kFilter = "davacl_upload";

// How many requests of each user wait for a body in this process.
class Waiting {
public:
    bool enter(const std::string& user, size_t most) {
        const std::lock_guard lock(_mutex);
        size_t& count = _counts[user];
        if (count >= most) return false;
        ++count;
        return true;
    }
    void leave(const std::string& user) {
        const std::lock_guard lock(_mutex);
        const auto found = _counts.find(user);
        if (found != _counts.end() && --found->second == 0) _counts.erase(found);
    }

private:
    std::mutex _mutex;
    std::unordered_map<std::string, size_t> _counts; // guarded by _mutex; none is 0 but within `enter`
};

// Lives as long as the process: other threads may still read when it ends.
Waiting& waiting() {
    static auto* all = new Waiting;
    return *all;
}

bool hasBody(const request_rec* r) {
    return apr_table_get(r->headers_in, "Transfer-Encoding") || apr_table_get(r->headers_in, "Content-Length");
}

apr_status_t readBounded(ap_filter_t* filter, apr_bucket_brigade* into, ap_input_mode_t mode, apr_read_type_e block,
                         apr_off_t bytes) noexcept {
    if (block != APR_BLOCK_READ || mode != AP_MODE_READBYTES)
        return ap_get_brigade(filter->next, into, mode, block, bytes);
    const apr_status_t status = ap_get_brigade(filter->next, into, mode, APR_NONBLOCK_READ, bytes);
    const bool isEmpty = APR_STATUS_IS_EAGAIN(status) || (status == APR_SUCCESS && APR_BRIGADE_EMPTY(into));
    if (!isEmpty) return status;
    request_rec* r = filter->r;
    const std::string user = r->user ? r->user : "";
    const size_t most = uploadsOfUser(r->server);
    if (!contained(r, true, [&] { return waiting().enter(user, most); })) {
        ap_log_rerror(APLOG_MARK, APLOG_INFO, 0, r, "davacl: too many requests of %s wait for their bodies",
                      user.c_str());
        r->connection->keepalive = AP_CONN_CLOSE; // what is left of the body is no request
        return APR_TIMEUP;
    }
    const apr_status_t read = ap_get_brigade(filter->next, into, mode, block, bytes);
    waiting().leave(user);
    return read;
}

} // namespace

void registerUploads() noexcept {
    ap_register_input_filter(kFilter, readBounded, nullptr, AP_FTYPE_RESOURCE);
}

void boundUpload(request_rec* r) noexcept {
    if (r->main || !r->user || uploadsOfUser(r->server) == 0 || !hasBody(r)) return;
    for (const ap_filter_t* each = r->input_filters; each; each = each->next)
        if (strcasecmp(each->frec->name, kFilter) == 0) return;
    ap_add_input_filter(kFilter, nullptr, r, r->connection);
}

void leaveRefusedBody(request_rec* r) noexcept {
    if (r->main || uploadsOfUser(r->server) == 0 || !hasBody(r) || r->status == HTTP_CONTINUE) return;
    if (!r->expecting_100) { // a body that is here is read, so that the connection may go on
        apr_bucket_brigade* read = apr_brigade_create(r->pool, r->connection->bucket_alloc);
        constexpr int kPieces = 64, kPiece = 16384;
        for (int i = 0; i < kPieces; ++i) {
            const apr_status_t status =
                ap_get_brigade(r->input_filters, read, AP_MODE_READBYTES, APR_NONBLOCK_READ, kPiece);
            const bool isEmpty = APR_BRIGADE_EMPTY(read);
            const bool isWhole = !isEmpty && APR_BUCKET_IS_EOS(APR_BRIGADE_LAST(read));
            apr_brigade_cleanup(read);
            if (status == APR_SUCCESS && isWhole) return;
            if (status != APR_SUCCESS || isEmpty) break;
        }
    }
    r->connection->keepalive = AP_CONN_CLOSE;
}

} // namespace rolvane::davacl
