#pragma once

#include "store/http/HttpTransport.h"

#include <chrono>
#include <curl/curl.h>
#include <memory>
#include <optional>
#include <string>

namespace rolvane {

using SteadyTime = std::chrono::steady_clock::time_point;

// A request on its way, with what is known of its answer so far.
struct HttpJob {
    HttpRequest request;
    HttpTransport::Completion done;
    std::shared_ptr<const TransportCredentials> credentials;
    std::string origin;
    SteadyTime deadline;
    uint64_t epoch = 0; // of abortAll at the hand-over
    int repetitions = 0;
    bool http1Only = false;
    bool onNewConnection = false; // a kept one has failed it
    bool wasSentTwice() const { return onNewConnection || http1Only; }
    bool metNoHandshake = false; // the TLS handshake of a new one has failed, once

    HttpResponse response;
    bool headerDone = false;  // of the final answer
    bool inHandshake = false; // a TLS handshake has begun, and is not over while `tries` is 0
    int tries = 0;            // libcurl repeats a request by itself when a kept connection turns out to be dead
    bool metDead = false;     // and has met the second one
    size_t headerBytes = 0, bodyBytes = 0;
    TransportError verdict = TransportError::none; // why the transfer was ended from our side
    std::string verdictDetail;

    void forgetAnswer();
    bool mayCarryCredentials() const; // only the credentials' own origins get them
};

// One reusable libcurl easy handle with its callbacks. Lives on the transport's thread.
class CurlSlot {
public:
    explicit CurlSlot(const CurlTransportOptions& options);
    ~CurlSlot();
    CurlSlot(const CurlSlot&) = delete;
    CurlSlot& operator=(const CurlSlot&) = delete;

    CURL* easy() const { return _easy; }
    HttpJob* job() const { return _job.get(); }

    struct Setting {
        bool digest = false;    // the origin wants Digest
        bool shared = false;    // over HTTP/2, as far as is known: requests share connections
        long longestIdle = 118; // seconds without use, of a connection that may carry the job
    };
    // Sets the handle up for the job.
    void prepare(std::unique_ptr<HttpJob> job, const Setting& setting);
    std::unique_ptr<HttpJob> release() { return std::move(_job); }

    // True when not a byte has moved for the job's idle limit. A handshake has all the time of the job: a server that
    // has much to do comes to it late, and whoever went away and came back would stand at the end of the line.
    bool isIdle(SteadyTime now);
    // The same of so many seconds, as isIdle has seen it last.
    bool isStill(SteadyTime now, double seconds) const;
    bool isHttp2() const; // known when the connection is
    // True when the job met kept connections only, and not a byte of an answer.
    bool metOnlyOldConnections() const;

private:
    static size_t onHeader(char* data, size_t size, size_t count, void* self);
    static size_t onBody(char* data, size_t size, size_t count, void* self);
    static curl_socket_t onOpen(void* self, curlsocktype purpose, curl_sockaddr* address);
    static CURLcode onHandshake(CURL* easy, void* context, void* self);
    static int onConnected(void* self, char* peerAddress, char* localAddress, int peerPort, int localPort);

    bool takeHeaderLine(std::string_view line);
    bool takeBody(std::string_view bytes);
    void setMethod();
    void setHeaders();
    void setCredentials(bool digest);
    void setProxy();
    void setVersion();
    void setConnection(const Setting& setting);

    CURL* _easy;
    curl_slist* _headers = nullptr;
    std::vector<std::pair<std::string, std::string>> _headersShown; // what `_headers` was built from
    bool _writerShown = false;
    std::shared_ptr<const TransportCredentials> _signedInAs;
    const bool _offersHttp2;
    bool _http1Only = false;
    bool _digest = false, _plain = false, _proxyOff = false, _shared = false;
    std::unique_ptr<HttpJob> _job;
    uint64_t _bytesMoved = 0;
    SteadyTime _lastMove;
};

} // namespace rolvane
