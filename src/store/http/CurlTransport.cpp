#include "foundation/Date.h"
#include "foundation/Mutex.h"
#include "store/http/ConnectionRamp.h"
#include "store/http/CurlDecisions.h"
#include "store/http/CurlSlot.h"
#include "store/http/HttpTransport.h"
#include "store/http/JobLine.h"
#include "store/http/KeptConnections.h"

#include <algorithm>
#include <set>
#include <signal.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <thread>
#include <unistd.h>
#include <unordered_set>

namespace rolvane {

namespace {

using namespace std::chrono;
using Steady = steady_clock;

// How often deadlines are looked at; more seldom while nothing but patient requests is under way.
constexpr auto kCheckPace = milliseconds(100), kPatientPace = milliseconds(5000);
constexpr double kPatientSeconds = 60;
constexpr double kStillSeconds = 0.2; // without a byte, of an answer that has begun
constexpr double kNudgeDeadline = 10;
// Without a request, after which every connection is closed: a store of a thousand daemons holds no place for those at
// rest, and none of them comes back to a connection that has died meanwhile.
constexpr double kRestSeconds = 3;

steady_clock::duration inSeconds(double s) {
    return duration_cast<steady_clock::duration>(duration<double>(s));
}

} // namespace

struct CurlTransport::Impl {
    explicit Impl(CurlTransportOptions o);
    ~Impl();

    // Any thread
    void enqueue(HttpRequest request, Completion done);
    void wake();

    // The transport's thread
    void makeMulti();
    void run();
    void renewConnections();
    void closeAtRest();
    void wait();
    void takeInbox();
    void dropAborted();
    void admit();
    void launch(std::unique_ptr<HttpJob> job);
    bool reap(); // true when a transfer was complete
    void finished(CurlSlot& slot, CURLcode code);
    bool sendAgain(std::unique_ptr<HttpJob>& job);
    void checkDeadlines();
    void nudge(SteadyTime now);
    void end(CurlSlot& slot, TransportError error, std::string detail);
    static void fail(std::unique_ptr<HttpJob> job, TransportError error, std::string detail);
    void detach(CurlSlot& slot);
    size_t admissionLimit() const;

    static int onSocket(CURL*, curl_socket_t s, int what, void* self, void* known);
    static int onTimer(CURLM*, long milliseconds, void* self);

    const CurlTransportOptions options;
    CURLM* multi = nullptr;
    int epoll = -1, event = -1;

    Mutex inboxMutex;
    std::vector<std::unique_ptr<HttpJob>> inbox GUARDED_BY(inboxMutex);
    std::shared_ptr<const TransportCredentials> credentials GUARDED_BY(inboxMutex);
    std::atomic<bool> sleeping{false}, stopping{false}, aborted{false}, connectionsAreStale{false};
    std::atomic<uint64_t> abortEpoch{0};
    std::atomic<uint64_t> requests{0}, connections{0}, challenged{0}, heldBackCount{0}, sentAnewCount{0};

    // The transport's thread only
    JobLine pending;
    std::vector<std::unique_ptr<CurlSlot>> slots;
    std::vector<CurlSlot*> idle;
    std::unordered_set<CurlSlot*> active;
    std::set<std::string> digestOrigins;
    std::set<std::string> http2Origins;
    KeptConnections kept;
    ConnectionRamp ramp;
    SteadyTime notBefore{}; // Retry-After
    std::optional<SteadyTime> curlTimer;
    std::optional<SteadyTime> closing; // when nothing comes until then; none: no connection stands
    SteadyTime nextCheck{};
    SteadyTime nextNudge{};
    double secondsToNudge = kStillSeconds;
    uint64_t seenEpoch = 0;
    std::thread thread;
};

CurlTransport::Impl::Impl(CurlTransportOptions o)
    : options(std::move(o)), kept(options.secondsAsleep ? options.secondsAsleep : KeptConnections::secondsAsleep),
      ramp(options.fewAtFirst.value_or(ConnectionRamp::Pace()), options.maxConnections) {
    static const CURLcode global = curl_global_init(CURL_GLOBAL_ALL);
    (void)global;
    epoll = epoll_create1(EPOLL_CLOEXEC);
    event = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    if (epoll < 0 || event < 0) throw std::bad_alloc();
    epoll_event wanted{};
    wanted.events = EPOLLIN;
    wanted.data.fd = event;
    epoll_ctl(epoll, EPOLL_CTL_ADD, event, &wanted);
    makeMulti();
    thread = std::thread([this] {
        sigset_t all; // signals are for the threads that expect them
        sigfillset(&all);
        pthread_sigmask(SIG_SETMASK, &all, nullptr);
        run();
    });
}

void CurlTransport::Impl::makeMulti() {
    multi = curl_multi_init();
    if (!multi) throw std::bad_alloc();
    curl_multi_setopt(multi, CURLMOPT_SOCKETFUNCTION, &Impl::onSocket);
    curl_multi_setopt(multi, CURLMOPT_SOCKETDATA, this);
    curl_multi_setopt(multi, CURLMOPT_TIMERFUNCTION, &Impl::onTimer);
    curl_multi_setopt(multi, CURLMOPT_TIMERDATA, this);
    curl_multi_setopt(multi, CURLMOPT_MAX_HOST_CONNECTIONS, static_cast<long>(options.maxConnections));
    curl_multi_setopt(multi, CURLMOPT_MAXCONNECTS, static_cast<long>(options.maxConnections + 2));
    curl_multi_setopt(multi, CURLMOPT_MAX_CONCURRENT_STREAMS, static_cast<long>(options.maxStreams));
    curl_multi_setopt(multi, CURLMOPT_PIPELINING, static_cast<long>(CURLPIPE_MULTIPLEX));
}

CurlTransport::Impl::~Impl() {
    stopping = true;
    wake();
    thread.join();
    slots.clear();
    curl_multi_cleanup(multi);
    close(epoll);
    close(event);
}

void CurlTransport::Impl::wake() {
    const uint64_t one = 1;
    [[maybe_unused]] const ssize_t written = ::write(event, &one, sizeof one);
}

void CurlTransport::Impl::enqueue(HttpRequest request, Completion done) {
    auto job = std::make_unique<HttpJob>();
    job->request = std::move(request);
    job->done = std::move(done);
    job->origin = job->request.url.origin();
    job->deadline = Steady::now() + inSeconds(job->request.limits.totalSeconds);
    job->epoch = abortEpoch;
    if (const std::string why = objection(*job); !why.empty())
        return fail(std::move(job), TransportError::refused, why);
    if (aborted || stopping) return fail(std::move(job), TransportError::aborted, "The program is ending.");
    {
        Lock guard(inboxMutex);
        job->credentials = credentials;
        inbox.push_back(std::move(job));
    }
    if (sleeping.exchange(false)) wake();
}

int CurlTransport::Impl::onSocket(CURL*, curl_socket_t s, int what, void* self, void* known) {
    auto* impl = static_cast<Impl*>(self);
    if (what == CURL_POLL_REMOVE) {
        epoll_ctl(impl->epoll, EPOLL_CTL_DEL, s, nullptr);
        return 0;
    }
    epoll_event wanted{};
    wanted.data.fd = s;
    wanted.events = (what & CURL_POLL_IN ? static_cast<uint32_t>(EPOLLIN) : 0u) |
                    (what & CURL_POLL_OUT ? static_cast<uint32_t>(EPOLLOUT) : 0u);
    if (epoll_ctl(impl->epoll, known ? EPOLL_CTL_MOD : EPOLL_CTL_ADD, s, &wanted) != 0)
        epoll_ctl(impl->epoll, known ? EPOLL_CTL_ADD : EPOLL_CTL_MOD, s, &wanted);
    curl_multi_assign(impl->multi, s, impl); // marks the socket as known
    return 0;
}

int CurlTransport::Impl::onTimer(CURLM*, long milliseconds, void* self) {
    auto* impl = static_cast<Impl*>(self);
    if (milliseconds < 0)
        impl->curlTimer.reset();
    else
        impl->curlTimer = Steady::now() + std::chrono::milliseconds(milliseconds);
    return 0;
}

// Closes every connection and begins without any. While requests are under way it has to wait: theirs go on.
void CurlTransport::Impl::renewConnections() {
    if (!connectionsAreStale.exchange(false)) return;
    const SteadyTime now = Steady::now();
    for (const CurlSlot* slot : active) kept.foundDead(slot->job()->origin, now);
    if (!active.empty()) return;
    closing.reset();
    ramp.closed();
    curl_multi_cleanup(multi);
    curlTimer.reset();
    makeMulti();
}

void CurlTransport::Impl::closeAtRest() {
    if (!active.empty() || !pending.empty()) closing = Steady::now() + inSeconds(kRestSeconds);
    if (closing && *closing <= Steady::now()) connectionsAreStale = true;
}

void CurlTransport::Impl::run() {
    while (!stopping) {
        takeInbox();
        dropAborted();
        if (!pending.empty() && kept.hasSlept()) connectionsAreStale = true;
        closeAtRest();
        renewConnections();
        admit();
        wait();
        reap();
        checkDeadlines();
    }
    ++abortEpoch;
    takeInbox();
    dropAborted();
}

void CurlTransport::Impl::wait() {
    int running = 0;
    for (int turns = 0; curlTimer && *curlTimer <= Steady::now() && turns < 4; ++turns) {
        curlTimer.reset();
        curl_multi_socket_action(multi, CURL_SOCKET_TIMEOUT, 0, &running);
    }
    // A timer may have completed a transfer; no socket would tell of it.
    const bool completed = reap();
    sleeping = true;
    int timeout = completed ? 0 : 60000;
    {
        Lock guard(inboxMutex);
        if (!inbox.empty()) timeout = 0;
    }
    const auto until = [&](SteadyTime t) {
        const auto ms = ceil<milliseconds>(t - Steady::now()).count();
        timeout = static_cast<int>(std::clamp<int64_t>(ms, 0, timeout));
    };
    if (curlTimer) until(*curlTimer);
    if (!active.empty() || !pending.empty()) until(nextCheck);
    if (closing) until(*closing);
    if (!pending.empty() && notBefore > Steady::now()) until(notBefore);
    epoll_event events[32];
    const int n = epoll_wait(epoll, events, 32, timeout);
    sleeping = false;
    for (int i = 0; i < n; ++i) {
        if (events[i].data.fd == event) {
            uint64_t count;
            [[maybe_unused]] const ssize_t got = ::read(event, &count, sizeof count);
            continue;
        }
        const uint32_t e = events[i].events;
        const int mask = (e & EPOLLIN ? CURL_CSELECT_IN : 0) | (e & EPOLLOUT ? CURL_CSELECT_OUT : 0) |
                         (e & (EPOLLERR | EPOLLHUP) ? CURL_CSELECT_ERR : 0);
        curl_multi_socket_action(multi, events[i].data.fd, mask, &running);
    }
}

void CurlTransport::Impl::takeInbox() {
    std::vector<std::unique_ptr<HttpJob>> fresh;
    {
        Lock guard(inboxMutex);
        fresh.swap(inbox);
    }
    if (!fresh.empty()) nextCheck = std::min(nextCheck, Steady::now() + kCheckPace);
    for (auto& job : fresh) {
        if (job->epoch < abortEpoch)
            fail(std::move(job), TransportError::aborted, "The program is ending.");
        else
            pending.add(std::move(job));
    }
}

// Abandons what was handed over before the latest abortAll.
void CurlTransport::Impl::dropAborted() {
    const uint64_t epoch = abortEpoch;
    if (epoch == seenEpoch) return;
    seenEpoch = epoch;
    const std::vector<CurlSlot*> running(active.begin(), active.end());
    for (CurlSlot* slot : running)
        if (slot->job()->epoch < epoch) end(*slot, TransportError::aborted, "The program is ending.");
    for (auto& job : pending.takeAll([epoch](const HttpJob& waiting) { return waiting.epoch < epoch; }))
        fail(std::move(job), TransportError::aborted, "The program is ending.");
}

size_t CurlTransport::Impl::admissionLimit() const {
    if (!http2Origins.empty()) return static_cast<size_t>(options.maxStreams);
    return static_cast<size_t>(options.fewAtFirst ? ramp.allowed() : options.maxConnections);
}

void CurlTransport::Impl::admit() {
    if (pending.empty() || notBefore > Steady::now()) return;
    while (!pending.empty() && active.size() < admissionLimit()) {
        launch(pending.takeFirst());
    }
}

void CurlTransport::Impl::launch(std::unique_ptr<HttpJob> job) {
    if (idle.empty()) {
        slots.push_back(std::make_unique<CurlSlot>(options));
        idle.push_back(slots.back().get());
    }
    CurlSlot* slot = idle.back();
    idle.pop_back();
    const auto scheme = job->credentials ? job->credentials->scheme : TransportCredentials::Scheme::basic;
    const bool digest = scheme == TransportCredentials::Scheme::digest ||
                        (scheme == TransportCredentials::Scheme::automatic && digestOrigins.contains(job->origin));
    nextCheck = active.empty() ? Steady::now() + kCheckPace : std::min(nextCheck, Steady::now() + kCheckPace);
    const bool shared = !job->http1Only && http2Origins.contains(job->origin);
    const long longestIdle = kept.longestIdle(job->origin, Steady::now());
    slot->prepare(std::move(job), {digest, shared, longestIdle});
    active.insert(slot);
    ++requests;
    if (curl_multi_add_handle(multi, slot->easy()) != CURLM_OK)
        end(*slot, TransportError::unreachable, "The request could not be started.");
}

bool CurlTransport::Impl::reap() {
    bool any = false;
    int left = 0;
    while (CURLMsg* message = curl_multi_info_read(multi, &left)) {
        if (message->msg != CURLMSG_DONE) continue;
        const CURLcode code = message->data.result;
        CurlSlot* slot = nullptr;
        curl_easy_getinfo(message->easy_handle, CURLINFO_PRIVATE, &slot);
        finished(*slot, code);
        any = true;
    }
    return any;
}

void CurlTransport::Impl::detach(CurlSlot& slot) {
    curl_multi_remove_handle(multi, slot.easy());
    active.erase(&slot);
    idle.push_back(&slot);
}

void CurlTransport::Impl::finished(CurlSlot& slot, CURLcode code) {
    long opened = 0, version = 0;
    curl_off_t left = 0, begun = 0; // microseconds since its start: the request could leave, the answer began
    curl_easy_getinfo(slot.easy(), CURLINFO_PRETRANSFER_TIME_T, &left);
    curl_easy_getinfo(slot.easy(), CURLINFO_STARTTRANSFER_TIME_T, &begun);
    curl_easy_getinfo(slot.easy(), CURLINFO_NUM_CONNECTS, &opened);
    curl_easy_getinfo(slot.easy(), CURLINFO_HTTP_VERSION, &version);
    connections += static_cast<uint64_t>(opened);
    const bool anew = needsNewConnection(slot, code);
    detach(slot);
    auto job = slot.release();
    if (anew) {
        if (code == CURLE_SSL_CONNECT_ERROR) {
            job->metNoHandshake = true;
        } else {
            ++sentAnewCount;
            kept.foundDead(job->origin, Steady::now());
            job->onNewConnection = true;
        }
        pending.addAgain(std::move(job));
        return;
    }
    kept.heard(job->origin, job->response);
    if (job->headerDone) ramp.answered(Steady::now(), microseconds(begun - left));
    if (version == CURL_HTTP_VERSION_2_0)
        http2Origins.insert(job->origin);
    else if (code == CURLE_OK && !job->http1Only && !http2Origins.empty())
        http2Origins.erase(job->origin);
    // A server that refuses an upload before it has read it resets the stream behind its answer (RFC 9113 section 8.1).
    // libcurl may drop the answer then; over HTTP/1.1 it comes through.
    if (code == CURLE_HTTP2_STREAM && !job->headerDone && !job->http1Only && job->verdict == TransportError::none) {
        job->http1Only = true;
        pending.addAgain(std::move(job));
        return;
    }
    const bool refusedEarly = code == CURLE_HTTP2_STREAM && job->headerDone && job->response.status >= 400;
    if (code != CURLE_OK && !refusedEarly) {
        const TransportError error = job->verdict != TransportError::none ? job->verdict : translated(code);
        const std::string detail = job->verdict != TransportError::none ? job->verdictDetail : reason(code, *job);
        return fail(std::move(job), error, detail);
    }
    if (!job->headerDone)
        return fail(std::move(job), TransportError::truncated, "The connection ended within the answer's header.");
    if (sendAgain(job)) return;
    auto done = std::move(job->done);
    job->response.sentTwice = job->wasSentTwice();
    done(std::move(job->response));
}

// Puts the job back in the queue when the answer asks for another try; true when it did.
bool CurlTransport::Impl::sendAgain(std::unique_ptr<HttpJob>& job) {
    const int status = job->response.status;
    if (status == 401) {
        ++challenged;
        const bool automatic =
            job->mayCarryCredentials() && job->credentials->scheme == TransportCredentials::Scheme::automatic;
        if (!automatic || job->repetitions > 0 || !wantsDigest(job->response)) return false;
        digestOrigins.insert(job->origin);
    } else if (status == 503 || status == 429) {
        const auto seconds = retryAfterSeconds(job->response, Clock::system().now());
        if (!seconds) return false;
        const SteadyTime until = Steady::now() + inSeconds(std::min(*seconds, options.maxRetryAfterSeconds));
        notBefore = std::max(notBefore, until);
        if (job->repetitions > 0 || until >= job->deadline) return false;
        ++heldBackCount;
    } else {
        return false;
    }
    ++job->repetitions;
    pending.addAgain(std::move(job));
    return true;
}

void CurlTransport::Impl::checkDeadlines() {
    const SteadyTime now = Steady::now();
    if (now < nextCheck) return;
    const bool allPatient =
        pending.empty() && !active.empty() && std::all_of(active.begin(), active.end(), [](const CurlSlot* slot) {
            return slot->job()->request.limits.idleSeconds >= kPatientSeconds;
        });
    nextCheck = now + (allPatient ? kPatientPace : kCheckPace);
    std::vector<std::pair<CurlSlot*, std::string>> late;
    for (CurlSlot* slot : active) {
        const HttpLimits& limits = slot->job()->request.limits;
        if (slot->job()->deadline <= now)
            late.emplace_back(slot, "No complete answer within " + std::to_string(limits.totalSeconds) + " s.");
        else if (slot->isIdle(now))
            late.emplace_back(slot, "Not a byte moved for " + std::to_string(limits.idleSeconds) + " s.");
    }
    if (!pending.empty() && notBefore <= now) ramp.othersWait(now);
    nudge(now);
    for (auto& [slot, detail] : late) end(*slot, TransportError::timedOut, detail);
    // Whoever cannot be served before the deadline hears it now.
    const SteadyTime served = std::max(now, notBefore);
    for (auto& job : pending.takeAll([served](const HttpJob& waiting) { return waiting.deadline <= served; }))
        fail(std::move(job), TransportError::timedOut, "The store could not take the request in time.");
}

// httpd may forget the end of a stream, although it has sent the whole body, until something else moves on the
// connection; the stream would stand still up to its limit. So while an answer that has begun over HTTP/2 stands still,
// and nothing else moves, a small request goes out, at growing intervals.
void CurlTransport::Impl::nudge(SteadyTime now) {
    const HttpJob* still = nullptr;
    for (const CurlSlot* slot : active) {
        if (!slot->isHttp2()) continue;
        if (!slot->isStill(now, kStillSeconds)) return;
        if (slot->job()->headerDone) still = slot->job();
    }
    if (!still) {
        secondsToNudge = kStillSeconds;
        return;
    }
    if (now < nextNudge) return;
    secondsToNudge *= 2;
    nextNudge = now + inSeconds(secondsToNudge);
    auto job = std::make_unique<HttpJob>();
    job->request.method = "OPTIONS";
    job->request.url = still->request.url;
    job->origin = still->origin;
    job->credentials = still->credentials;
    job->deadline = now + inSeconds(kNudgeDeadline);
    job->epoch = abortEpoch;
    job->done = [](const HttpResponse&) {};
    pending.addFirst(std::move(job));
}

void CurlTransport::Impl::end(CurlSlot& slot, TransportError error, std::string detail) {
    detach(slot);
    fail(slot.release(), error, std::move(detail));
}

void CurlTransport::Impl::fail(std::unique_ptr<HttpJob> job, TransportError error, std::string detail) {
    HttpResponse answer;
    answer.error = error;
    answer.detail = std::move(detail);
    answer.sentTwice = job->wasSentTwice();
    if (job->headerDone) answer.headers = std::move(job->response.headers);
    job->done(std::move(answer));
}

CurlTransport::CurlTransport(CurlTransportOptions options) : _impl(std::make_unique<Impl>(std::move(options))) {}
CurlTransport::~CurlTransport() = default;

HttpResponse CurlTransport::perform(HttpRequest request) {
    struct Waiting {
        Mutex mutex;
        Condition changed;
        std::optional<HttpResponse> answer GUARDED_BY(mutex);
    };
    auto waiting = std::make_shared<Waiting>();
    _impl->enqueue(std::move(request), [waiting](HttpResponse answer) {
        Lock guard(waiting->mutex);
        waiting->answer = std::move(answer);
        waiting->changed.notify_one();
    });
    // The transport's thread answers every request by its deadline.
    Lock lock(waiting->mutex);
    waiting->changed.wait(lock, [&]() REQUIRES(waiting->mutex) { return waiting->answer.has_value(); });
    return std::move(*waiting->answer);
}

void CurlTransport::start(HttpRequest request, Completion done) {
    _impl->enqueue(std::move(request), std::move(done));
}

void CurlTransport::abortAll() {
    _impl->aborted = true;
    ++_impl->abortEpoch;
    _impl->wake();
}

void CurlTransport::resume() {
    _impl->aborted = false;
}

void CurlTransport::networkChanged() {
    _impl->connectionsAreStale = true;
    _impl->wake();
}

void CurlTransport::setCredentials(std::optional<TransportCredentials> credentials) {
    auto fresh = credentials ? std::make_shared<const TransportCredentials>(std::move(*credentials)) : nullptr;
    Lock guard(_impl->inboxMutex);
    _impl->credentials = std::move(fresh);
}

CurlTransport::Statistics CurlTransport::statistics() const {
    return {_impl->requests, _impl->connections, _impl->challenged, _impl->heldBackCount, _impl->sentAnewCount};
}

} // namespace rolvane
