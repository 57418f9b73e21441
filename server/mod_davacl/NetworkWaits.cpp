#include "server/mod_davacl/NetworkWaits.h"

#include "server/mod_davacl/Configuration.h"
#include "server/mod_davacl/EachSecond.h"
#include "server/mod_davacl/SlowThreads.h"

#include <apr_portable.h>
#include <chrono>
#include <http_connection.h>
#include <list>
#include <mutex>
#include <optional>
#include <sys/socket.h>

namespace rolvane::davacl {
namespace {

using Clock = std::chrono::steady_clock;

constexpr const char* kFilter = "davacl_waits";
constexpr const char* kKey = "davacl-waits";

// A connection, or a stream of one (HTTP/2), which has a connection of its own above the real one.
struct Line {
    Line* real = nullptr; // null: it is the real one
    int socket = -1;      // of the real one, as long as it is not being closed
    size_t most = 0;
    bool sums = true; // waits of one request are summed up; not on a real one that has streams

    // Guarded by the lock of all.
    SlowThread seen;
    Clock::time_point since;
};

class Waits {
public:
    using Place = std::list<Line*>::iterator;

    Place enter(Line& line, bool sends) {
        const std::lock_guard lock(_mutex);
        line.since = Clock::now();
        line.seen.sends = sends;
        if (!line.sums) line.seen.waited = {};
        _inside.push_back(&line);
        return std::prev(_inside.end());
    }
    void leave(Place place, uint64_t bytes) {
        const std::lock_guard lock(_mutex);
        Line& line = **place;
        _inside.erase(place);
        line.seen.waited += std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - line.since);
        line.seen.taken += bytes;
    }
    void begin(Line& line) {
        const std::lock_guard lock(_mutex);
        line.seen.waited = {};
        line.seen.taken = 0;
    }
    void signIn(Line& line, const char* user) {
        const std::lock_guard lock(_mutex);
        if (line.seen.user != user) line.seen.user = user;
        if (line.real && line.real->seen.user != user) line.real->seen.user = user;
        if (line.real) line.real->sums = false;
    }
    void close(Line& line) {
        const std::lock_guard lock(_mutex);
        line.socket = -1;
    }
    bool isFull(const Line& line, const char* user) {
        const std::lock_guard lock(_mutex);
        return hasShareOf(seen(), line.most, user);
    }
    void endSurplus(const server_rec* server, size_t most) {
        const std::lock_guard lock(_mutex);
        const auto all = seen();
        const auto surplus = surplusOf(all, most);
        if (surplus.empty()) return;
        const std::vector<Line*> lines(_inside.begin(), _inside.end());
        for (const size_t i : surplus) {
            const Line& real = lines[i]->real ? *lines[i]->real : *lines[i];
            if (real.socket >= 0) shutdown(real.socket, SHUT_RDWR); // its thread finds the end
            ap_log_error(APLOG_MARK, APLOG_INFO, 0, server,
                         "davacl: a connection of %s was closed: a thread waited for its network, as did %d others",
                         all[i].user.empty() ? "nobody" : all[i].user.c_str(), static_cast<int>(all.size()) - 1);
        }
    }

private:
    std::vector<SlowThread> seen() const {
        std::vector<SlowThread> all;
        all.reserve(_inside.size());
        const auto now = Clock::now();
        for (const Line* line : _inside) {
            all.push_back(line->seen);
            all.back().waited += std::chrono::duration_cast<std::chrono::milliseconds>(now - line->since);
        }
        return all;
    }
    std::mutex _mutex;
    std::list<Line*> _inside; // guarded by _mutex
};

// Lives as long as the process: other threads may still wait when it ends.
Waits& waits() {
    static auto* all = new Waits;
    return *all;
}

Line* lineOf(conn_rec* c) {
    void* line = nullptr;
    apr_pool_userdata_get(&line, kKey, c->pool);
    return static_cast<Line*>(line);
}

uint64_t bytesIn(apr_bucket_brigade* brigade) {
    apr_off_t length = 0;
    return apr_brigade_length(brigade, 0, &length) == APR_SUCCESS && length > 0 ? static_cast<uint64_t>(length) : 0;
}

template <class Call>
apr_status_t noted(ap_filter_t* filter, bool sends, uint64_t bytes, Call call) noexcept {
    auto& line = *static_cast<Line*>(filter->ctx);
    std::optional<Waits::Place> place;
    try {
        place = waits().enter(line, sends);
    } catch (const std::exception&) { // without memory for it, it is not counted
    }
    const apr_status_t status = call();
    if (place) waits().leave(*place, status == APR_SUCCESS ? bytes : 0);
    return status;
}

apr_status_t writeNoted(ap_filter_t* filter, apr_bucket_brigade* brigade) noexcept {
    if (!brigade || APR_BRIGADE_EMPTY(brigade)) return ap_pass_brigade(filter->next, brigade);
    return noted(filter, true, bytesIn(brigade), [&] { return ap_pass_brigade(filter->next, brigade); });
}

apr_status_t readNoted(ap_filter_t* filter, apr_bucket_brigade* into, ap_input_mode_t mode, apr_read_type_e block,
                       apr_off_t bytes) noexcept {
    if (block != APR_BLOCK_READ) return ap_get_brigade(filter->next, into, mode, block, bytes);
    return noted(filter, false, 0, [&] { return ap_get_brigade(filter->next, into, mode, block, bytes); });
}

size_t mostIn(const server_rec* server) {
    size_t most = 0;
    for (; server; server = server->next) most = std::max(most, mostSlowThreads(server));
    return most;
}

apr_status_t endEachSecond(void* watch) {
    delete static_cast<EachSecond*>(watch);
    return APR_SUCCESS;
}

} // namespace

void registerNetworkWaits() noexcept {
    constexpr auto kNextToTheNetwork = static_cast<ap_filter_type>(AP_FTYPE_NETWORK - 1);
    ap_register_input_filter(kFilter, readNoted, nullptr, kNextToTheNetwork);
    ap_register_output_filter(kFilter, writeNoted, nullptr, kNextToTheNetwork);
}

int watchConnection(conn_rec* c, void* socket) noexcept {
    const size_t most = mostSlowThreads(c->base_server);
    if (most == 0) return OK;
    auto* line = new (apr_palloc(c->pool, sizeof(Line))) Line;
    apr_pool_userdata_set(
        line, kKey,
        [](void* it) -> apr_status_t {
            static_cast<Line*>(it)->~Line();
            return APR_SUCCESS;
        },
        c->pool);
    line->most = most;
    apr_os_sock_t number = -1;
    if (c->master)
        line->real = lineOf(c->master);
    else if (apr_os_sock_get(&number, static_cast<apr_socket_t*>(socket)) == APR_SUCCESS)
        line->socket = number;
    ap_add_input_filter(kFilter, line, nullptr, c);
    ap_add_output_filter(kFilter, line, nullptr, c);
    return OK;
}

int endWatching(conn_rec* c) noexcept {
    if (Line* line = lineOf(c)) waits().close(*line);
    return OK;
}

int beginRequest(request_rec* r) noexcept {
    if (Line* line = lineOf(r->connection)) waits().begin(*line);
    return DECLINED;
}

int boundSlowThreads(request_rec* r) noexcept {
    Line* line = r->main || !r->user ? nullptr : lineOf(r->connection);
    if (!line) return DECLINED;
    return contained(r, static_cast<int>(HTTP_INTERNAL_SERVER_ERROR), [&]() -> int {
        waits().signIn(*line, r->user);
        if (!waits().isFull(*line, r->user)) return DECLINED;
        ap_log_rerror(APLOG_MARK, APLOG_INFO, 0, r, "davacl: too many threads wait for the network of %s", r->user);
        apr_table_setn(r->err_headers_out, "Retry-After", "10");
        r->connection->keepalive = AP_CONN_CLOSE;
        return HTTP_SERVICE_UNAVAILABLE;
    });
}

void watchSlowThreads(apr_pool_t* pool, server_rec* server) noexcept {
    const size_t most = mostIn(server);
    if (most == 0) return;
    try {
        auto* watch = new EachSecond([server, most] { waits().endSurplus(server, most); });
        apr_pool_cleanup_register(pool, watch, endEachSecond, apr_pool_cleanup_null);
    } catch (const std::exception& e) {
        ap_log_error(APLOG_MARK, APLOG_ERR, 0, server, "davacl: slow threads are not watched: %s", e.what());
    }
}

} // namespace rolvane::davacl
