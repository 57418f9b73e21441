#include "server/mod_davacl/WaitingRequests.h"

#include "server/mod_davacl/Access.h"
#include "server/mod_davacl/LiveProperties.h"
#include "server/mod_davacl/News.h"
#include "server/mod_davacl/Passwords.h"
#include "server/mod_davacl/ReportBody.h"

#include <algorithm>
#include <ap_mpm.h>
#include <apr_portable.h>
#include <condition_variable>
#include <csignal>
#include <cstring>
#include <deque>
#include <fcntl.h>
#include <http_connection.h>
#include <iterator>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/ioctl.h>
#include <sys/resource.h>
#include <termios.h>
#include <thread>
#include <unistd.h>
#include <unordered_map>
#include <vector>

namespace rolvane::davacl {
namespace {

constexpr size_t kMostTrees = 1000;             // of one request
constexpr int kMostUnsent = 16384;              // bytes in the socket: who does not take them away is let go
constexpr size_t kWorkers = 2;                  // write the lines
constexpr auto kPace = apr_time_from_msec(250); // between two lines about changes: those in between are one
// The thread that took the request in marks the connection once more behind the last hook that it calls.
constexpr auto kLetGo = apr_time_from_msec(50);
constexpr auto kLongest = apr_time_from_sec(3600); // then the client signs in anew
constexpr int kListenMilliseconds = 60000, kWriterMilliseconds = 20;
constexpr auto kLongestNote = apr_time_from_sec(2); // a note takes its writer some nanoseconds

struct Waiter {
    uint64_t id = 0;
    request_rec* r = nullptr;
    const Configuration* c = nullptr;
    std::string user;
    std::optional<std::string> password; // its hash, where there is one
    std::vector<TreePath> trees;
    std::vector<uint64_t> numbers; // of the trees
    std::vector<bool> told;        // of which trees; the others may not be read
    uint64_t writer = 0;           // whose changes are no news to it
    int socket = -1;
    apr_interval_time_t beat = 0;
    apr_time_t ends = 0;
    bool begun = false; // the first line is out

    // Guarded by the lock of all.
    std::set<size_t> changed;
    bool suspended = false; // the thread that took the request in has let go of it
    bool called = false;    // in the queue, or being answered
    bool gone = false;      // the client has closed, or sent something
    bool over = false;      // the process stops
    apr_time_t nextBeat = 0, nextLine = 0;
    std::optional<apr_time_t> due; // its place in the time line
};

// -- what one waiter is told

bool mayRead(const Waiter& w, const TreePath& tree) {
    return privilegesOn(w.r, *w.c, tree) & kRead;
}

bool hasPassword(const Waiter& w) {
    return !w.password || hashInForce(w.r, w.user) == w.password;
}

// Everything that it was allowed at the beginning.
bool mayGoOn(const Waiter& w) {
    stateOf(w.r).forgetLists();
    if (!hasPassword(w)) return false;
    for (size_t i = 0; i < w.trees.size(); ++i)
        if (w.told[i] && !mayRead(w, w.trees[i])) return false;
    return true;
}

bool takesLinesAway(const Waiter& w) {
    int unsent = 0;
    return w.socket < 0 || ioctl(w.socket, TIOCOUTQ, &unsent) != 0 || unsent <= kMostUnsent;
}

std::string linesAbout(const Waiter& w, const std::set<size_t>& changed, const std::string& token) {
    std::string text;
    for (const size_t i : changed)
        if (w.told[i]) text += "news " + std::to_string(i + 1) + " " + token + "\n";
    return text;
}

std::string firstLines(Waiter& w, const std::string& token) {
    std::string text = "begin " + token + " " + std::to_string(apr_time_sec(w.beat)) + "\n";
    stateOf(w.r).forgetLists();
    for (size_t i = 0; i < w.trees.size(); ++i) {
        w.told[i] = mayRead(w, w.trees[i]);
        if (!w.told[i]) text += "no " + std::to_string(i + 1) + "\n";
    }
    return text;
}

bool sendLines(const Waiter& w, const std::string& text) {
    if (!takesLinesAway(w)) return false;
    return ap_rwrite(text.data(), static_cast<int>(text.size()), w.r) >= 0 && ap_rflush(w.r) >= 0 &&
           !w.r->connection->aborted;
}

// False when the answer ends here.
bool tell(Waiter& w, const std::set<size_t>& changed, uint64_t position, bool beat) {
    const std::string token = newsRing()->token(position);
    std::string text;
    if (!w.begun) {
        text = firstLines(w, token);
        if (!hasPassword(w)) return false;
        w.begun = true;
    } else if (!mayGoOn(w)) {
        return false;
    }
    text += linesAbout(w, changed, token);
    if (text.empty() && beat) text = "still " + token + "\n";
    return text.empty() || sendLines(w, text);
}

void endConnection(conn_rec* c) {
    ap_prep_lingering_close(c); // TLS says good-bye
    ap_flush_conn(c);
    ap_shutdown_conn(c, 1);
    c->cs->state = CONN_STATE_SUSPENDED; // what the MPM has counted it as
    apr_pool_destroy(c->pool);
}

// -- all of one process

class Waiters {
public:
    Waiters() : _epoll(epoll_create1(EPOLL_CLOEXEC)), _event(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
        if (_epoll < 0 || _event < 0) throw std::bad_alloc();
        epoll_event wanted{};
        wanted.events = EPOLLIN;
        wanted.data.u64 = 0; // no waiter's id
        epoll_ctl(_epoll, EPOLL_CTL_ADD, _event, &wanted);
        _consumed = newsRing()->position();
        sigset_t everything, before;
        sigfillset(&everything);
        pthread_sigmask(SIG_SETMASK, &everything, &before); // signals are the other threads'
        _threads.emplace_back([this] { watch(); });
        _threads.emplace_back([this] { listen(); });
        for (size_t i = 0; i < kWorkers; ++i) _threads.emplace_back([this] { answerAll(); });
        pthread_sigmask(SIG_SETMASK, &before, nullptr);
    }
    // The threads must be gone before the process's pool is.
    ~Waiters() {
        {
            const std::lock_guard lock(_mutex);
            _ending = true;
        }
        _dueNow.notify_all();
        poke();
        newsRing()->ring();
        for (auto& thread : _threads) thread.join();
        close(_epoll);
        close(_event);
    }
    Waiters(const Waiters&) = delete;
    Waiters& operator=(const Waiters&) = delete;

    // HTTP_OK when it was taken in, else the status to answer with. Told from the position on; from now without one.
    int add(std::unique_ptr<Waiter> fresh, std::optional<uint64_t> since, bool sinceGiven) {
        const std::lock_guard lock(_mutex);
        if (_stopping || _all.size() >= mostWaiters()) return HTTP_SERVICE_UNAVAILABLE;
        auto& mine = _ofUser[fresh->user];
        if (mine >= newsOfUser(*fresh->c)) return HTTP_TOO_MANY_REQUESTS;
        ++mine;
        Waiter* w = fresh.get();
        w->id = ++_lastId;
        for (size_t i = 0; i < w->trees.size(); ++i) _byNumber.emplace(w->numbers[i], std::pair(w, i));
        _all.emplace(w->id, std::move(fresh));
        w->nextBeat = apr_time_now() + w->beat;
        if (!sinceGiven) return HTTP_OK;
        const auto missed = since ? newsRing()->from(*since) : NewsRing::Notes{false, {}, 0};
        if (!missed.some) markAll(*w);
        for (const NewsRing::Note& note : missed.notes)
            for (size_t i = 0; i < w->numbers.size(); ++i)
                if (w->numbers[i] == note.tree && isNewsTo(*w, note)) w->changed.insert(i);
        return HTTP_OK;
    }
    void remove(uint64_t id) {
        const std::lock_guard lock(_mutex);
        const auto found = _all.find(id);
        if (found == _all.end()) return;
        Waiter* w = found->second.get();
        if (w->socket >= 0) epoll_ctl(_epoll, EPOLL_CTL_DEL, w->socket, nullptr);
        unschedule(*w);
        for (const uint64_t number : w->numbers) {
            const auto [first, last] = _byNumber.equal_range(number);
            for (auto each = first; each != last;) each = each->second.first == w ? _byNumber.erase(each) : next(each);
        }
        if (--_ofUser[w->user] == 0) _ofUser.erase(w->user);
        std::erase(_due, w);
        _all.erase(found);
    }
    void suspended(uint64_t id) {
        const std::lock_guard lock(_mutex);
        const auto found = _all.find(id);
        if (found == _all.end()) return;
        Waiter* w = found->second.get();
        w->suspended = true;
        if (w->socket >= 0) {
            epoll_event wanted{};
            wanted.events = EPOLLIN | EPOLLRDHUP | EPOLLONESHOT;
            wanted.data.u64 = w->id;
            epoll_ctl(_epoll, EPOLL_CTL_ADD, w->socket, &wanted);
        }
        schedule(*w, apr_time_now() + kLetGo);
    }
    void stop() {
        const std::lock_guard lock(_mutex);
        _stopping = true;
        for (const auto& [id, w] : _all) {
            w->over = true;
            if (mayBeCalled(*w)) call(*w);
        }
    }

private:
    static size_t mostWaiters() {
        rlimit limit{};
        constexpr rlim_t kOtherwise = 512;
        const bool known = getrlimit(RLIMIT_NOFILE, &limit) == 0 && limit.rlim_cur != RLIM_INFINITY;
        return known ? limit.rlim_cur / 2 : kOtherwise;
    }
    static bool isNewsTo(const Waiter& w, const NewsRing::Note& note) {
        return !note.writer || note.writer != w.writer;
    }
    static void markAll(Waiter& w) {
        for (size_t i = 0; i < w.trees.size(); ++i) w.changed.insert(i);
    }
    void poke() const {
        const uint64_t one = 1;
        [[maybe_unused]] const ssize_t written = write(_event, &one, sizeof one);
    }

    // -- under the lock
    void call(Waiter& w) {
        unschedule(w);
        w.called = true;
        _due.push_back(&w);
        _dueNow.notify_one();
    }
    void unschedule(Waiter& w) {
        if (!w.due) return;
        const auto [first, last] = _timeLine.equal_range(*w.due);
        const auto mine = std::find_if(first, last, [&](const auto& each) { return each.second == &w; });
        if (mine != last) _timeLine.erase(mine);
        w.due.reset();
    }
    void schedule(Waiter& w, apr_time_t at) {
        if (w.due && *w.due <= at) return;
        unschedule(w);
        const bool first = _timeLine.empty() || at < _timeLine.begin()->first;
        w.due = at;
        _timeLine.emplace(at, &w);
        if (first) poke();
    }
    // Whoever is being answered, or has its first turn before it, takes then what has come meanwhile.
    static bool mayBeCalled(const Waiter& w) { return w.suspended && !w.called && w.begun; }
    void changedFor(Waiter& w) {
        if (!mayBeCalled(w)) return;
        if (w.nextLine <= apr_time_now())
            call(w);
        else
            schedule(w, w.nextLine);
    }

    // -- the threads
    // Takes the notes out of the ring. Behind a note whose writer has died in the middle of it anything may have
    // changed.
    void listen() {
        apr_time_t moved = apr_time_now();
        for (;;) {
            const uint32_t bell = newsRing()->bell();
            bool waitsForWriter = false;
            {
                const std::lock_guard lock(_mutex);
                if (_ending) return;
                auto news = newsRing()->from(_consumed);
                const uint64_t end = newsRing()->position();
                if (news.next != _consumed || news.next == end) moved = apr_time_now();
                if (apr_time_now() - moved > kLongestNote) news = {false, {}, end};
                waitsForWriter = news.next != end;
                _consumed = news.next;
                spread(news);
            }
            newsRing()->waitForBell(bell, waitsForWriter ? kWriterMilliseconds : kListenMilliseconds);
        }
    }
    void spread(const NewsRing::Notes& news) {
        if (!news.some)
            for (const auto& [id, w] : _all) {
                markAll(*w);
                changedFor(*w);
            }
        for (const NewsRing::Note& note : news.notes) {
            const auto [first, last] = _byNumber.equal_range(note.tree);
            for (auto each = first; each != last; ++each) {
                auto& [w, index] = each->second;
                if (isNewsTo(*w, note) && w->changed.insert(index).second) changedFor(*w);
            }
        }
    }
    // Notices clients that go, and what is due by the clock.
    void watch() {
        for (;;) {
            int timeout = -1;
            {
                const std::lock_guard lock(_mutex);
                if (_ending) return;
                const apr_time_t now = apr_time_now();
                while (!_timeLine.empty() && _timeLine.begin()->first <= now) call(*_timeLine.begin()->second);
                if (!_timeLine.empty())
                    timeout = static_cast<int>((_timeLine.begin()->first - now) / apr_time_from_msec(1)) + 1;
            }
            epoll_event events[64];
            const int count = epoll_wait(_epoll, events, 64, timeout);
            for (int i = 0; i < count; ++i) {
                if (events[i].data.u64 == 0) {
                    uint64_t value = 0;
                    [[maybe_unused]] const ssize_t got = read(_event, &value, sizeof value);
                    continue;
                }
                const std::lock_guard lock(_mutex);
                const auto found = _all.find(events[i].data.u64);
                if (found == _all.end()) continue;
                found->second->gone = true;
                if (mayBeCalled(*found->second)) call(*found->second);
            }
        }
    }
    void answerAll() {
        for (;;) {
            Waiter* w = nullptr;
            {
                std::unique_lock lock(_mutex);
                _dueNow.wait(lock, [this] { return !_due.empty() || _ending; });
                if (_due.empty()) return;
                w = _due.front();
                _due.pop_front();
            }
            answer(*w);
        }
    }
    void answer(Waiter& w) {
        request_rec* r = w.r;
        apr_thread_mutex_lock(r->invoke_mtx); // not before the handler has returned
        apr_thread_mutex_unlock(r->invoke_mtx);
        std::set<size_t> changed;
        bool gone = false, over = false, beat = false;
        uint64_t position = 0;
        const apr_time_t now = apr_time_now();
        {
            const std::lock_guard lock(_mutex);
            gone = w.gone;
            over = w.over || now >= w.ends;
            beat = now >= w.nextBeat;
            changed.swap(w.changed);
            position = _consumed;
        }
        const bool told = !gone && contained(r, false, [&] { return tell(w, changed, position, beat); });
        if (told && !over) {
            const std::lock_guard lock(_mutex);
            w.called = false;
            const apr_time_t then = apr_time_now();
            if (!changed.empty()) w.nextLine = then + kPace;
            if (!changed.empty() || beat) w.nextBeat = then + w.beat;
            if (w.gone || w.over) return call(w);
            schedule(w, std::min(w.nextBeat, w.ends));
            if (!w.changed.empty()) schedule(w, w.nextLine);
            return;
        }
        end(w.id, r, gone || (!told && r->connection->aborted));
    }
    void end(uint64_t id, request_rec* r, bool gone) {
        conn_rec* c = r->connection;
        remove(id);
        c->keepalive = AP_CONN_CLOSE;
        if (gone) c->aborted = 1;
        ap_finalize_request_protocol(r);
        ap_process_request_after_handler(r); // destroys r
        endConnection(c);
    }

    const int _epoll, _event;
    std::mutex _mutex; // guards the following, and the lower half of each waiter
    std::unordered_map<uint64_t, std::unique_ptr<Waiter>> _all;
    std::unordered_multimap<uint64_t, std::pair<Waiter*, size_t>> _byNumber; // of a tree
    std::map<std::string, size_t> _ofUser;
    std::multimap<apr_time_t, Waiter*> _timeLine;
    std::deque<Waiter*> _due;
    uint64_t _lastId = 0, _consumed = 0; // the ring's position up to which everybody has been called
    bool _stopping = false, _ending = false;
    std::condition_variable _dueNow;
    std::vector<std::thread> _threads;
};

Waiters* waiters = nullptr; // of this process

apr_status_t endThreads(void*) {
    delete waiters;
    waiters = nullptr;
    return APR_SUCCESS;
}

// -- taking a request in

dav_error* complaint(request_rec* r, int status, const char* words) {
    return dav_new_error(r->pool, status, 0, 0, words);
}

std::optional<TreePath> treeAt(request_rec* r, const Configuration& c, const std::string& href) {
    apr_uri_t uri;
    if (apr_uri_parse(r->pool, href.c_str(), &uri) != APR_SUCCESS || !uri.path) return std::nullopt;
    if (uri.hostname && (!r->hostname || strcasecmp(uri.hostname, r->hostname) != 0)) return std::nullopt;
    char* path = apr_pstrdup(r->pool, uri.path);
    if (ap_unescape_url(path) != OK) return std::nullopt;
    char* clean = apr_pstrdup(r->pool, path);
    ap_no2slash(clean);
    ap_getparents(clean);
    const auto place = std::strcmp(clean, path) == 0 ? TreePath::of(c.base, path) : std::nullopt;
    if (!place || place->isBase() || place->levels() > c.levels() || place->isReserved()) return std::nullopt;
    return place;
}

// Nothing when something is wrong with it; then `error` says what.
std::vector<TreePath> treesIn(request_rec* r, const Configuration& c, const NewsBody& body, dav_error** error) {
    std::vector<TreePath> trees;
    for (const std::string& href : body.hrefs) {
        auto tree = treeAt(r, c, href);
        if (!tree) {
            *error = complaint(r, HTTP_BAD_REQUEST,
                               "An href names no tree: a collection below the base, as near to it as lists are kept.");
            return {};
        }
        trees.push_back(std::move(*tree));
    }
    if (trees.empty() || trees.size() > kMostTrees) {
        *error = complaint(r, HTTP_BAD_REQUEST, "Name the trees to hear of, each in a DAV:href: 1 to 1000 of them.");
        return {};
    }
    return trees;
}

apr_status_t forgetWaiter(void* id) {
    if (waiters) waiters->remove(*static_cast<const uint64_t*>(id));
    return APR_SUCCESS;
}

int socketOf(conn_rec* c) {
    apr_socket_t* socket = ap_get_conn_socket(c);
    apr_os_sock_t descriptor = -1;
    return socket && apr_os_sock_get(&descriptor, socket) == APR_SUCCESS ? descriptor : -1;
}

std::unique_ptr<Waiter> waiterFor(request_rec* r, const Configuration& c, std::vector<TreePath> trees) {
    auto w = std::make_unique<Waiter>();
    w->r = r;
    w->c = &c;
    w->user = r->user;
    w->password = hashInForce(r, w->user);
    for (const TreePath& tree : trees) w->numbers.push_back(NewsRing::numberOf(tree.owner + "/" + tree.tree()));
    w->trees = std::move(trees);
    w->told.resize(w->trees.size());
    if (const char* writer = apr_table_get(r->headers_in, kWriterHeader); writer && *writer)
        w->writer = NewsRing::numberOf(w->user + "\n" + writer);
    w->socket = socketOf(r->connection);
    w->beat = apr_time_from_sec(newsHeartbeat(c));
    uint32_t random = 0;
    ap_random_insecure_bytes(&random, sizeof random);
    w->ends =
        apr_time_now() + kLongest - static_cast<apr_time_t>(random % (apr_time_sec(kLongest) / 4)) * APR_USEC_PER_SEC;
    return w;
}

constexpr const char* kWaits = "davacl-waits"; // a note of a request that waits: where its number is

} // namespace

std::string newsReportElement() {
    return std::string("<D:supported-report><D:report><R:") + kNewsReport + " xmlns:R=\"" + kOwnNamespace +
           "\"/></D:report></D:supported-report>";
}

int waitForNews(request_rec* r, const Configuration& c, const apr_xml_doc* doc, dav_error** error) {
    const auto fails = [&](int status, const char* words) {
        *error = complaint(r, status, words);
        return status;
    };
    // mod_http2 ends a stream that is suspended with an error, and the prefork MPM suspends nothing.
    if (!waiters || !tellsNews(r) || r->connection->master || r->main)
        return fails(HTTP_NOT_IMPLEMENTED, "News are told over HTTP/1.1, where DavAclNews is on and the MPM is event.");
    const NewsBody body = readNewsBody(doc);
    auto trees = treesIn(r, c, body, error);
    if (*error) return (*error)->status;
    auto fresh = waiterFor(r, c, std::move(trees));
    auto* id = static_cast<uint64_t*>(apr_pcalloc(r->pool, sizeof(uint64_t)));
    Waiter* w = fresh.get();
    const int status = waiters->add(std::move(fresh), body.since ? newsRing()->positionOf(*body.since) : std::nullopt,
                                    body.since.has_value());
    if (status == HTTP_TOO_MANY_REQUESTS) return fails(status, "Too many requests of yours wait for news already.");
    if (status != HTTP_OK) return fails(status, "No more requests can wait for news here now.");
    *id = w->id;
    apr_pool_cleanup_register(r->pool, id, forgetWaiter, apr_pool_cleanup_null);
    apr_table_setn(r->notes, kWaits, reinterpret_cast<const char*>(id));
    // httpd sends no chunks on a connection that it is going to close; the client is to see that the answer is whole.
    r->connection->keepalive = AP_CONN_CLOSE;
    constexpr int kWithChunks = HTTP_VERSION(1, 1);
    if (r->proto_num >= kWithChunks) r->chunked = 1;
    r->status = HTTP_OK;
    ap_set_content_type(r, "text/plain; charset=utf-8");
    apr_table_setn(r->headers_out, "Cache-Control", "no-store");
    apr_table_setn(r->headers_out, "X-Accel-Buffering", "no"); // a proxy is to hand each line on
    apr_table_setn(r->subprocess_env, "no-gzip", "1");
    return OK;
}

int handedOver(request_rec* r, int answer) {
    return apr_table_get(r->notes, kWaits) && answer == DONE ? SUSPENDED : answer;
}

void startWaiting(apr_pool_t* pool, server_rec* server) noexcept {
    if (!newsRing()) return;
    try {
        waiters = new Waiters;
        apr_pool_pre_cleanup_register(pool, nullptr, endThreads);
    } catch (const std::exception& e) {
        ap_log_error(APLOG_MARK, APLOG_ERR, 0, server, "davacl: no news are told: %s", e.what());
    }
}

void noteSuspended(conn_rec*, request_rec* r) noexcept {
    const char* id = r && waiters ? apr_table_get(r->notes, kWaits) : nullptr;
    if (!id) return;
    contained(r, false, [&] {
        waiters->suspended(*reinterpret_cast<const uint64_t*>(id));
        return true;
    });
}

void endWaiting(apr_pool_t*, int) noexcept {
    if (!waiters) return;
    try {
        waiters->stop();
    } catch (const std::exception&) { // they end with the process
    }
}

} // namespace rolvane::davacl
