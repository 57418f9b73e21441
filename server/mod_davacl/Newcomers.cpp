#include "server/mod_davacl/Newcomers.h"

#include "server/mod_davacl/Configuration.h"
#include "server/mod_davacl/EachSecond.h"
#include "server/mod_davacl/NewcomerBound.h"

#include <apr_portable.h>
#include <chrono>
#include <fcntl.h>
#include <mutex>
#include <netinet/in.h>
#include <string>
#include <sys/socket.h>
#include <unistd.h>
#include <unordered_map>

namespace rolvane::davacl {
namespace {

using Clock = std::chrono::steady_clock;

std::string addressOf(const conn_rec* c) {
    const apr_sockaddr_t* address = c->client_addr;
    const char* bytes = static_cast<const char*>(address->ipaddr_ptr);
    if (address->ipaddr_len == sizeof(in6_addr)) {
        constexpr size_t kNetwork = 8, kMapped = 12;
        if (IN6_IS_ADDR_V4MAPPED(reinterpret_cast<const in6_addr*>(bytes)))
            return {bytes + kMapped, sizeof(in6_addr) - kMapped};
        return {bytes, kNetwork};
    }
    return {bytes, static_cast<size_t>(address->ipaddr_len)};
}

// The newcomers of one process of httpd.
class Newcomers {
public:
    // The descriptor is a copy, so that its number stays the connection's until it is taken out here.
    void add(const conn_rec* c, int socket, size_t most) {
        const std::lock_guard lock(_mutex);
        const auto [found, isNew] = _all.try_emplace(c);
        if (!isNew) {
            found->second.seen.heard = Clock::now();
            return;
        }
        const int copy = fcntl(socket, F_DUPFD_CLOEXEC, 0);
        if (copy >= 0) found->second = {{addressOf(c), most, false, Clock::now()}, copy};
    }
    void setBusy(const conn_rec* c, bool busy) {
        const std::lock_guard lock(_mutex);
        const auto found = _all.find(c);
        if (found == _all.end()) return;
        found->second.seen.busy = busy;
        found->second.seen.heard = Clock::now();
    }
    bool knows(const conn_rec* c) {
        const std::lock_guard lock(_mutex);
        return _all.contains(c);
    }
    // It counts no more; the entry stays as long as the connection, so that it does not come in again.
    void forget(const conn_rec* c) {
        const std::lock_guard lock(_mutex);
        if (const auto found = _all.find(c); found != _all.end()) release(found->second);
    }
    void remove(const conn_rec* c) {
        const std::lock_guard lock(_mutex);
        const auto found = _all.find(c);
        if (found == _all.end()) return;
        release(found->second);
        _all.erase(found);
    }
    void closeSurplus(const server_rec* server) {
        const std::lock_guard lock(_mutex);
        std::vector<Newcomer> counted;
        std::vector<One*> ones;
        for (auto& [c, one] : _all) {
            if (one.socket < 0) continue;
            counted.push_back(one.seen);
            ones.push_back(&one);
        }
        if (surplusOf(counted, Clock::now()).empty()) return; // as nearly always: nobody's socket is asked
        for (size_t i = 0; i < ones.size(); ++i) counted[i].busy = counted[i].busy || waitsForUs(*ones[i]);
        const auto surplus = surplusOf(counted, Clock::now());
        for (const size_t i : surplus) {
            shutdown(ones[i]->socket, SHUT_RDWR); // httpd finds its end
            release(*ones[i]);
        }
        if (!surplus.empty())
            ap_log_error(APLOG_MARK, APLOG_INFO, 0, server,
                         "davacl: %d of %d connections without a sign-in were closed: they said nothing, and their "
                         "address has more than DavAclNewcomers",
                         static_cast<int>(surplus.size()), static_cast<int>(counted.size()));
    }

private:
    struct One {
        Newcomer seen;
        int socket = -1; // none: it does not count
    };
    static bool waitsForUs(const One& one) {
        char byte = 0;
        return recv(one.socket, &byte, 1, MSG_PEEK | MSG_DONTWAIT) > 0;
    }
    static void release(One& one) {
        if (one.socket >= 0) close(one.socket);
        one.socket = -1;
    }

    std::mutex _mutex;
    std::unordered_map<const conn_rec*, One> _all; // guarded by _mutex
};

// Lives as long as the process: other threads may still ask when it ends.
Newcomers& newcomers() {
    static auto* all = new Newcomers;
    return *all;
}

apr_status_t connectionEnds(void* c) {
    newcomers().remove(static_cast<conn_rec*>(c));
    return APR_SUCCESS;
}

const conn_rec* connectionOf(const request_rec* r) {
    return r->connection->master ? r->connection->master : r->connection;
}

apr_status_t endWatch(void* watch) {
    delete static_cast<EachSecond*>(watch);
    return APR_SUCCESS;
}

} // namespace

int noteConnection(conn_rec* c) noexcept {
    const int most = c->master ? 0 : mostNewcomers(c->base_server);
    apr_os_sock_t socket = -1;
    if (most <= 0 || !c->client_addr || !ap_get_conn_socket(c) ||
        apr_os_sock_get(&socket, ap_get_conn_socket(c)) != APR_SUCCESS)
        return DECLINED;
    try {
        if (!newcomers().knows(c)) apr_pool_cleanup_register(c->pool, c, connectionEnds, apr_pool_cleanup_null);
        newcomers().add(c, socket, static_cast<size_t>(most));
    } catch (const std::exception&) { // without memory for it, it is not counted
    }
    return DECLINED;
}

int noteRequest(request_rec* r) noexcept {
    newcomers().setBusy(connectionOf(r), true);
    return DECLINED;
}

int noteSignIn(request_rec* r) noexcept {
    if (r->user && !r->main) newcomers().forget(connectionOf(r));
    return DECLINED;
}

int noteAnswer(request_rec* r) noexcept {
    newcomers().setBusy(connectionOf(r), false);
    return DECLINED;
}

void watchNewcomers(apr_pool_t* pool, server_rec* server) noexcept {
    bool wanted = false;
    for (const server_rec* each = server; each; each = each->next) wanted = wanted || mostNewcomers(each) > 0;
    if (!wanted) return;
    try {
        apr_pool_cleanup_register(pool, new EachSecond([server] { newcomers().closeSurplus(server); }), endWatch,
                                  apr_pool_cleanup_null);
    } catch (const std::exception& e) {
        ap_log_error(APLOG_MARK, APLOG_ERR, 0, server, "davacl: newcomers are not watched: %s", e.what());
    }
}

} // namespace rolvane::davacl
