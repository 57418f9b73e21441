#pragma once

#include "foundation/Date.h"
#include "foundation/Url.h"
#include "store/http/ConnectionRamp.h"

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace rolvane {

// What went wrong below HTTP. `none` says that a complete answer came, whatever its status.
enum class TransportError {
    none,
    unreachable, // name not resolved, no connection, connection lost
    timedOut,    // the total or the per-read deadline
    tls,         // certificate or handshake
    tooLarge,    // the answer passed a limit
    truncated,   // the answer ended before its announced end, or was no HTTP
    refused,     // the transport would not send it: plain http off the machine, unusable URL
    aborted      // abortAll
};
const char* description(TransportError error);

struct HttpLimits {
    double totalSeconds = 60;          // from `perform` to the last byte, waiting for a connection included
    double idleSeconds = 20;           // without a byte either way; until the connection is there, too, handshake aside
    size_t maxBodyBytes = 64u << 20;   // of the answer
    size_t maxHeaderBytes = 64u << 10; // of the answer, all header lines together
};

struct HttpRequest {
    std::string method;
    Url url;
    std::vector<std::pair<std::string, std::string>> headers; // no line breaks or NUL in them
    std::shared_ptr<const std::string> body;                  // none: no body; shared so that nothing is copied
    HttpLimits limits;
    // When set, the answer's body is handed over as it arrives and `HttpResponse::body` stays empty; false ends the
    // request with `tooLarge`. Called on the transport's thread, only for the status `sinkStatus`.
    std::function<bool(std::string_view)> sink;
    int sinkStatus = 207;
    // It asks for what may be a file or a collection: that the answer sends to the same place with a slash tells which,
    // and is told to whoever asked instead of being followed (StoreSession; a transport follows nothing).
    bool tellsKind = false;
    // Nobody waits for it yet: while there is no connection for all, those without this go first.
    bool givesWay = false;
};

struct HttpResponse {
    TransportError error = TransportError::none;
    std::string detail;                                       // for people, when error is not none
    int status = 0;                                           // 0 when error is not none
    std::vector<std::pair<std::string, std::string>> headers; // of the final answer, names in lower case;
                                                              // also of one whose body failed
    std::string body;
    // A kept connection had ended behind the request, which was sent a second time. The server may have carried out the
    // first one; this is the answer to the second, or says that none came.
    bool sentTwice = false;

    bool complete() const { return error == TransportError::none; }
    bool ok() const { return complete() && status >= 200 && status < 300 && status != 207; } // what counts as success
    const std::string* header(std::string_view lowerCaseName) const; // the first of that name, or none
};
// Retry-After (RFC 9110 section 10.2.3) in seconds from `now`, at most 1,000,000; nothing when there is none or it
// makes no sense.
std::optional<double> retryAfterSeconds(const HttpResponse& answer, const Date& now);

// Sends requests to the network store. Exists so that tests can inject faults. Any thread; nothing throws but
// std::bad_alloc. Redirects are never followed: a 3xx is an answer like any other.
class HttpTransport {
public:
    virtual ~HttpTransport() = default;

    // Waits for the answer, at most the request's total deadline (and a little more).
    virtual HttpResponse perform(HttpRequest request) = 0;

    // Starts a request; `done` is called exactly once, on the transport's thread, and must not wait for anything.
    using Completion = std::function<void(HttpResponse)>;
    virtual void start(HttpRequest request, Completion done) = 0;

    // All at once, answers in the order of the requests.
    std::vector<HttpResponse> performAll(std::vector<HttpRequest> requests);

    // Ends every request under way and every later one with `aborted`, until `resume`. Returns at once; may be called
    // from a signal handler.
    virtual void abortAll() = 0;
    virtual void resume() = 0;

    // The machine has another network, or is awake again: connections that stand may be dead. They are not used again.
    virtual void networkChanged() {}
};

// What a CurlTransport signs in with, and where.
struct TransportCredentials {
    std::string user, password;
    std::vector<std::string> origins; // Url::origin of the only places that get them
    enum class Scheme { automatic, basic, digest } scheme = Scheme::automatic;
};

struct CurlTransportOptions {
    std::string caFile; // empty: the system's authorities
    std::string userAgent;
    int maxConnections = 10;          // to one origin over HTTP/1.1
    int maxStreams = 100;             // on one HTTP/2 connection
    double maxRetryAfterSeconds = 60; // a longer Retry-After is taken as this
    bool http2 = true;                // offer it
    // Not all connections at once, unless the store turns out to be far; none: as many as there are requests.
    std::optional<ConnectionRamp::Pace> fewAtFirst;
    // Seconds that the machine has spent asleep since its start; none: as the kernel has it. For tests. On the
    // transport's thread.
    std::function<double()> secondsAsleep;
};

// The transport over libcurl: one thread owns a multi handle and every connection; other threads hand requests over.
// HTTP/2 where the server offers it over TLS (one connection carries up to 100 requests at a time), else HTTP/1.1 with
// at most `maxConnections` kept-alive connections. Credentials go out unasked, to their origins only, over TLS or to a
// peer that is the loopback interface (the address of the connection is checked, not the name). Digest costs one
// challenge a connection handle, then goes unasked too. A 503 or 429 with Retry-After holds back all requests to all
// places until then, and the refused request is sent once more if its deadline allows.
//
// A request that fails on a kept connection before a byte of the answer came is sent once more on a new one, if
// mayBeSentTwice: the server may have carried the first one out. One whose TLS handshake the server ended is sent once
// more, whatever its method, since nobody has seen it. Connections that nobody used for 30 seconds, or nearly
// as long as the server said it keeps them, are not used again; nor is any after the machine slept. Where nobody
// acknowledges the bytes sent for 10 seconds, the connection is dead.
class CurlTransport : public HttpTransport {
public:
    explicit CurlTransport(CurlTransportOptions options);
    ~CurlTransport() override; // aborts what is under way and joins the thread

    HttpResponse perform(HttpRequest request) override;
    void start(HttpRequest request, Completion done) override;
    void abortAll() override;
    void resume() override;
    void networkChanged() override;

    // Requests handed over from now on carry these; none: no credentials.
    void setCredentials(std::optional<TransportCredentials> credentials);

    struct Statistics {
        uint64_t requests = 0;    // sent, repetitions included
        uint64_t connections = 0; // opened
        uint64_t challenged = 0;  // 401 answers
        uint64_t heldBack = 0;    // waits for a Retry-After
        uint64_t sentAnew = 0;    // repetitions because a kept connection was dead
    };
    Statistics statistics() const;

private:
    struct Impl;
    std::unique_ptr<Impl> _impl;
};

} // namespace rolvane
