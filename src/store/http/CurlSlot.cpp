#include "store/http/CurlSlot.h"

#include "store/account/Account.h"
#include "store/http/WriterName.h"

#include <algorithm>
#include <arpa/inet.h>
#include <cstring>
#include <netinet/tcp.h>
#include <new>
#include <sys/socket.h>

namespace rolvane {

void HttpJob::forgetAnswer() {
    response = {};
    headerDone = false;
    headerBytes = bodyBytes = 0;
    tries = 0;
    inHandshake = false;
    metDead = false;
    verdict = TransportError::none;
    verdictDetail.clear();
}

bool HttpJob::mayCarryCredentials() const {
    return credentials &&
           std::find(credentials->origins.begin(), credentials->origins.end(), origin) != credentials->origins.end();
}

namespace {

// Of bytes that nobody acknowledges: longer than lost packets take on a poor line, shorter than anybody likes to wait.
constexpr unsigned kDeadMilliseconds = 10000;

constexpr long kSlackMilliseconds = 1000;

bool isLoopbackAddress(const char* text) {
    in_addr v4;
    if (inet_pton(AF_INET, text, &v4) == 1) return (ntohl(v4.s_addr) >> 24) == 127;
    in6_addr v6;
    if (inet_pton(AF_INET6, text, &v6) != 1) return false;
    if (IN6_IS_ADDR_V4MAPPED(&v6)) return v6.s6_addr[12] == 127;
    return IN6_IS_ADDR_LOOPBACK(&v6);
}

std::string lowered(std::string_view text) {
    std::string out(text);
    for (char& c : out)
        if (c >= 'A' && c <= 'Z') c = static_cast<char>(c + 32);
    return out;
}

std::string_view trimmed(std::string_view text) {
    while (!text.empty() && (text.front() == ' ' || text.front() == '\t')) text.remove_prefix(1);
    while (!text.empty() && strchr(" \t\r\n", text.back())) text.remove_suffix(1);
    return text;
}

} // namespace

CurlSlot::CurlSlot(const CurlTransportOptions& options) : _easy(curl_easy_init()), _offersHttp2(options.http2) {
    if (!_easy) throw std::bad_alloc();
    curl_easy_setopt(_easy, CURLOPT_PRIVATE, this);
    curl_easy_setopt(_easy, CURLOPT_HEADERFUNCTION, &CurlSlot::onHeader);
    curl_easy_setopt(_easy, CURLOPT_HEADERDATA, this);
    curl_easy_setopt(_easy, CURLOPT_WRITEFUNCTION, &CurlSlot::onBody);
    curl_easy_setopt(_easy, CURLOPT_WRITEDATA, this);
    curl_easy_setopt(_easy, CURLOPT_OPENSOCKETFUNCTION, &CurlSlot::onOpen);
    curl_easy_setopt(_easy, CURLOPT_PREREQFUNCTION, &CurlSlot::onConnected);
    curl_easy_setopt(_easy, CURLOPT_PREREQDATA, this);
    curl_easy_setopt(_easy, CURLOPT_SSL_CTX_FUNCTION, &CurlSlot::onHandshake);
    curl_easy_setopt(_easy, CURLOPT_SSL_CTX_DATA, this);
    curl_easy_setopt(_easy, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(_easy, CURLOPT_NOPROGRESS, 1L);
    curl_easy_setopt(_easy, CURLOPT_FOLLOWLOCATION, 0L);
    curl_easy_setopt(_easy, CURLOPT_PROTOCOLS_STR, "http,https");
    curl_easy_setopt(_easy, CURLOPT_PATH_AS_IS, 1L);
    // Nobody asks for a compressed answer (setHeaders); one that comes all the same is decoded, within the limits.
    curl_easy_setopt(_easy, CURLOPT_ACCEPT_ENCODING, "");
    curl_easy_setopt(_easy, CURLOPT_TCP_NODELAY, 1L);
    curl_easy_setopt(_easy, CURLOPT_TCP_KEEPALIVE, 1L);
    curl_easy_setopt(_easy, CURLOPT_QUICK_EXIT, 1L);
    curl_easy_setopt(_easy, CURLOPT_USERAGENT, options.userAgent.c_str());
    curl_easy_setopt(_easy, CURLOPT_SSL_VERIFYPEER, 1L);
    curl_easy_setopt(_easy, CURLOPT_SSL_VERIFYHOST, 2L);
    if (!options.caFile.empty()) {
        curl_easy_setopt(_easy, CURLOPT_CAINFO, options.caFile.c_str());
        curl_easy_setopt(_easy, CURLOPT_CAPATH, nullptr);
    }
    _http1Only = _offersHttp2; // the other way round, so that it is set
    setVersion();
}

CurlSlot::~CurlSlot() {
    curl_easy_cleanup(_easy);
    curl_slist_free_all(_headers);
}

void CurlSlot::prepare(std::unique_ptr<HttpJob> job, const Setting& setting) {
    _job = std::move(job);
    _job->forgetAnswer();
    curl_easy_setopt(_easy, CURLOPT_URL, _job->request.url.absoluteString().c_str());
    curl_easy_setopt(_easy, CURLOPT_MAXFILESIZE_LARGE, static_cast<curl_off_t>(_job->request.limits.maxBodyBytes));
    // The job's own limits say when to give up, isIdle for a connection that does not come.
    curl_easy_setopt(_easy, CURLOPT_CONNECTTIMEOUT_MS,
                     static_cast<long>(_job->request.limits.totalSeconds * 1000) + kSlackMilliseconds);
    setMethod();
    setHeaders();
    setCredentials(setting.digest);
    setProxy();
    setVersion();
    setConnection(setting);
    _plain = _job->origin.starts_with("http:");
    _bytesMoved = 0;
    _lastMove = std::chrono::steady_clock::now();
}

void CurlSlot::setMethod() {
    const HttpRequest& r = _job->request;
    if (r.method == "HEAD") {
        curl_easy_setopt(_easy, CURLOPT_HTTPGET, 1L);
        curl_easy_setopt(_easy, CURLOPT_CUSTOMREQUEST, nullptr);
        curl_easy_setopt(_easy, CURLOPT_NOBODY, 1L);
        return;
    }
    if (r.body) {
        // Post fields leave in one segment together with the headers; the body is borrowed from the job.
        curl_easy_setopt(_easy, CURLOPT_NOBODY, 0L);
        curl_easy_setopt(_easy, CURLOPT_POST, 1L);
        curl_easy_setopt(_easy, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(r.body->size()));
        curl_easy_setopt(_easy, CURLOPT_POSTFIELDS, r.body->data());
    } else {
        curl_easy_setopt(_easy, CURLOPT_NOBODY, 0L);
        curl_easy_setopt(_easy, CURLOPT_HTTPGET, 1L);
    }
    curl_easy_setopt(_easy, CURLOPT_CUSTOMREQUEST, r.method.c_str());
}

void CurlSlot::setHeaders() {
    const auto& wanted = _job->request.headers;
    const bool showsWriter = namesItsWriter(_job->request.method);
    if (_headers && wanted == _headersShown && showsWriter == _writerShown) return;
    curl_slist_free_all(_headers);
    _headers = nullptr;
    bool hasType = false;
    const auto add = [this](const std::string& line) {
        curl_slist* longer = curl_slist_append(_headers, line.c_str());
        if (!longer) throw std::bad_alloc();
        _headers = longer;
    };
    for (const auto& [name, value] : wanted) {
        hasType = hasType || lowered(name) == "content-type";
        add(value.empty() ? name + ";" : name + ": " + value);
    }
    add("Accept:");
    add("Expect:");
    add("Accept-Encoding:");
    if (!hasType) add("Content-Type:");
    if (showsWriter) add(kWriterHeader + (": " + writerName()));
    _writerShown = showsWriter;
    _headersShown = wanted;
    curl_easy_setopt(_easy, CURLOPT_HTTPHEADER, _headers);
}

void CurlSlot::setCredentials(bool digest) {
    auto wanted = _job->mayCarryCredentials() ? _job->credentials : nullptr;
    if (wanted == _signedInAs && digest == _digest) return;
    _signedInAs = wanted;
    _digest = digest;
    curl_easy_setopt(_easy, CURLOPT_USERNAME, wanted ? wanted->user.c_str() : nullptr);
    curl_easy_setopt(_easy, CURLOPT_PASSWORD, wanted ? wanted->password.c_str() : nullptr);
    curl_easy_setopt(_easy, CURLOPT_HTTPAUTH, static_cast<long>(digest ? CURLAUTH_DIGEST : CURLAUTH_BASIC));
}

void CurlSlot::setVersion() {
    // HTTP/2 is agreed on in the TLS handshake only; waiting for it elsewhere would hold up the other connections.
    const bool http1Only = !_offersHttp2 || (_job && (_job->http1Only || _job->origin.starts_with("http:")));
    if (http1Only == _http1Only) return;
    _http1Only = http1Only;
    curl_easy_setopt(_easy, CURLOPT_HTTP_VERSION,
                     static_cast<long>(http1Only ? CURL_HTTP_VERSION_1_1 : CURL_HTTP_VERSION_2TLS));
    curl_easy_setopt(_easy, CURLOPT_PIPEWAIT, http1Only ? 0L : 1L);
}

// Over HTTP/1.1 a request that was sent before gets a connection of its own. Over HTTP/2, where all share one, libcurl
// leaves a broken one by itself.
void CurlSlot::setConnection(const Setting& setting) {
    _shared = setting.shared;
    curl_easy_setopt(_easy, CURLOPT_FRESH_CONNECT, _job->onNewConnection && !_shared ? 1L : 0L);
    curl_easy_setopt(_easy, CURLOPT_MAXAGE_CONN, setting.longestIdle);
}

void CurlSlot::setProxy() {
    const bool off = isLoopbackHost(_job->request.url.host());
    if (off == _proxyOff) return;
    _proxyOff = off;
    curl_easy_setopt(_easy, CURLOPT_PROXY, off ? "" : nullptr);
}

bool CurlSlot::isIdle(SteadyTime now) {
    curl_off_t sent = 0;
    if (_job->tries == 0 && _job->inHandshake) _lastMove = now;
    curl_easy_getinfo(_easy, CURLINFO_SIZE_UPLOAD_T, &sent);
    const uint64_t moved = static_cast<uint64_t>(sent) + _job->headerBytes + _job->bodyBytes;
    if (moved != _bytesMoved) {
        _bytesMoved = moved;
        _lastMove = now;
    }
    return std::chrono::duration<double>(now - _lastMove).count() > _job->request.limits.idleSeconds;
}

bool CurlSlot::isStill(SteadyTime now, double seconds) const {
    return std::chrono::duration<double>(now - _lastMove).count() > seconds;
}

bool CurlSlot::isHttp2() const {
    long version = 0;
    curl_easy_getinfo(_easy, CURLINFO_HTTP_VERSION, &version);
    return version == CURL_HTTP_VERSION_2_0;
}

bool CurlSlot::metOnlyOldConnections() const {
    long opened = 0;
    curl_easy_getinfo(_easy, CURLINFO_NUM_CONNECTS, &opened);
    return opened == 0 && _job->headerBytes + _job->bodyBytes == 0;
}

// A program that is started while the connection stands, such as a daemon, must not hold it.
curl_socket_t CurlSlot::onOpen(void*, curlsocktype, curl_sockaddr* address) {
    const int made = ::socket(address->family, address->socktype | SOCK_CLOEXEC, address->protocol);
    if (made >= 0) ::setsockopt(made, IPPROTO_TCP, TCP_USER_TIMEOUT, &kDeadMilliseconds, sizeof kDeadMilliseconds);
    return made;
}

// The server has taken the connection.
CURLcode CurlSlot::onHandshake(CURL*, void*, void* self) {
    static_cast<CurlSlot*>(self)->_job->inHandshake = true;
    return CURLE_OK;
}

// Plain http leaves only towards this machine, whatever the name in the URL resolved to. And libcurl, which repeats a
// request on the next kept connection when one is dead, and gives up after five, is stopped at the second: the job then
// goes out on a new one.
int CurlSlot::onConnected(void* self, char* peerAddress, char*, int, int) {
    auto* slot = static_cast<CurlSlot*>(self);
    if (++slot->_job->tries > 1 && !slot->_shared && slot->metOnlyOldConnections()) {
        slot->_job->metDead = true;
        return CURL_PREREQFUNC_ABORT;
    }
    if (!slot->_plain || isLoopbackAddress(peerAddress)) return CURL_PREREQFUNC_OK;
    slot->_job->verdict = TransportError::refused;
    slot->_job->verdictDetail = "The store's address is not on this machine, so nothing is sent to it unencrypted.";
    return CURL_PREREQFUNC_ABORT;
}

size_t CurlSlot::onHeader(char* data, size_t size, size_t count, void* self) {
    return static_cast<CurlSlot*>(self)->takeHeaderLine({data, size * count}) ? size * count : 0;
}

size_t CurlSlot::onBody(char* data, size_t size, size_t count, void* self) {
    return static_cast<CurlSlot*>(self)->takeBody({data, size * count}) ? size * count : 0;
}

bool CurlSlot::takeHeaderLine(std::string_view line) {
    HttpJob& job = *_job;
    job.headerBytes += line.size();
    if (job.headerBytes > job.request.limits.maxHeaderBytes) {
        job.verdict = TransportError::tooLarge;
        job.verdictDetail =
            "The answer's header passed " + std::to_string(job.request.limits.maxHeaderBytes) + " bytes.";
        return false;
    }
    if (line.starts_with("HTTP/")) { // a new answer: what came before was an interim one or a challenge
        job.response.headers.clear();
        job.response.body.clear();
        job.headerDone = false;
        const size_t space = line.find(' ');
        job.response.status =
            space == std::string_view::npos ? 0 : atoi(std::string(line.substr(space + 1, 3)).c_str());
        return true;
    }
    if (trimmed(line).empty()) {
        job.headerDone = job.response.status >= 200;
        return true;
    }
    const size_t colon = line.find(':');
    if (colon == std::string_view::npos) return true;
    job.response.headers.emplace_back(lowered(trimmed(line.substr(0, colon))),
                                      std::string(trimmed(line.substr(colon + 1))));
    return true;
}

bool CurlSlot::takeBody(std::string_view bytes) {
    HttpJob& job = *_job;
    job.bodyBytes += bytes.size();
    if (job.bodyBytes > job.request.limits.maxBodyBytes) {
        job.verdict = TransportError::tooLarge;
        job.verdictDetail = "The answer passed " + std::to_string(job.request.limits.maxBodyBytes) + " bytes.";
        return false;
    }
    if (job.request.sink && job.response.status == job.request.sinkStatus) {
        if (job.request.sink(bytes)) return true;
        job.verdict = TransportError::tooLarge;
        job.verdictDetail = "The answer passed a limit of its reader.";
        return false;
    }
    job.response.body.append(bytes);
    return true;
}

} // namespace rolvane
