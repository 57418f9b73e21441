#include "store/http/StoreSession.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "foundation/SignOfLife.h"
#include "foundation/TestSwitch.h"
#include "store/dav/Collections.h"
#include "store/dav/Multistatus.h"
#include "store/http/ExpectedAnswer.h"

#include <algorithm>
#include <cstdlib>
#include <strings.h>
#include <utility>

namespace rolvane {

namespace {

constexpr int64_t kBeliefMilliseconds = 30000;
constexpr int64_t kHangMilliseconds = 600000; // that long the tree's OPTIONS are not waited for again
constexpr HttpLimits kOptionsLimits{20, 10, 1u << 20, 64u << 10};

int64_t steadyMilliseconds() {
    using namespace std::chrono;
    return duration_cast<milliseconds>(steady_clock::now().time_since_epoch()).count() + 1;
}

TransportCredentials::Scheme schemeOf(Authentication a) {
    switch (a) {
    case Authentication::basic: return TransportCredentials::Scheme::basic;
    case Authentication::digest: return TransportCredentials::Scheme::digest;
    case Authentication::automatic: break;
    }
    return TransportCredentials::Scheme::automatic;
}

constexpr std::string_view kSyncClass = "<http://rolvane.net/ns/sync-collection>";
constexpr std::string_view kMembersTagClass = "<http://rolvane.net/ns/members-tag>";

std::shared_ptr<const std::string> makePropfindBody(const char* more) {
    return std::make_shared<const std::string>(
        std::string("<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<propfind xmlns=\"DAV:\"><prop><resourcetype/>"
                    "<getlastmodified/><getcontentlength/><getetag/>") +
        more + "</prop></propfind>");
}

const std::shared_ptr<const std::string>& propfindBody(bool withMembersTags) {
    static const auto plain = makePropfindBody("");
    static const auto tags = makePropfindBody("<members-tag xmlns=\"http://rolvane.net/ns/\"/>");
    return withMembersTags ? tags : plain;
}

const std::shared_ptr<const std::string>& lockdiscoveryBody() {
    static const auto body =
        std::make_shared<const std::string>("<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<propfind "
                                            "xmlns=\"DAV:\"><prop><lockdiscovery/></prop></propfind>");
    return body;
}

// A success with another status than the standard's, with the standard's.
HttpResponse asStandard(std::string_view method, HttpResponse answer) {
    if (method == "PROPFIND" && answer.status == 200) answer.status = 207;
    if (method == "DELETE" && answer.status == 207 && namesNoFailure(answer)) answer.status = 204;
    return answer;
}

// The answer to a request that has no password to go with.
HttpResponse unsent() {
    HttpResponse answer;
    answer.error = TransportError::refused;
    answer.detail = "The password of the account cannot be had.";
    return answer;
}

} // namespace

bool announcesDavClass(const HttpResponse& answer, std::string_view wanted) {
    for (const auto& [name, value] : answer.headers) {
        if (name != "dav") continue;
        for (size_t at = 0; at <= value.size();) {
            const size_t comma = std::min(value.find(',', at), value.size());
            const size_t first = value.find_first_not_of(" \t", at);
            if (first < comma) {
                const std::string_view rest = std::string_view(value).substr(first, comma - first);
                const std::string_view token = rest.substr(0, rest.find_last_not_of(" \t") + 1);
                if (token.size() == wanted.size() && strncasecmp(token.data(), wanted.data(), token.size()) == 0)
                    return true;
            }
            at = comma + 1;
        }
    }
    return false;
}

bool announcesDav(const HttpResponse& answer) {
    return announcesDavClass(answer, "1") || announcesDavClass(answer, "2") || announcesDavClass(answer, "3");
}

namespace {

CurlTransportOptions transportOptions(const CXDAVAccount& account) {
    CurlTransportOptions options;
    options.caFile = account.caFile;
    options.userAgent = CXDAVManager::ostrelUserAgent();
    // HTTP/2 pays where the way is long. Within a machine there is nothing to wait for, and its framing costs both ends
    // about half as much again as ten plain connections do.
    for (const std::string& origin : account.origins())
        options.http2 = options.http2 && !isLoopbackHost(Url(origin + "/").host());
    if (!options.http2) options.fewAtFirst.emplace();
    if (const char* wish = getenv("ROLVANE_HTTP2")) options.http2 = std::string_view(wish) == "always"; // measurements
    return options;
}

} // namespace

std::unique_ptr<CurlTransport> makeAccountTransport(const CXDAVAccount& account) {
    return std::make_unique<CurlTransport>(transportOptions(account));
}

StoreSession::StoreSession(CXDAVAccount account, std::shared_ptr<HttpTransport> transport, CurlTransport* signsIn)
    : _account(std::move(account)), _map(_account), _transport(std::move(transport)), _signsIn(signsIn) {}

std::optional<Url> StoreSession::endpoint(const Url& name, bool securely) const {
    return _map.endpointFor(name, securely);
}

std::optional<Url> StoreSession::collectionEndpoint(const Url& name, bool securely) const {
    const auto url = endpoint(name, securely);
    return url ? std::optional(namedAsCollection(*url)) : std::nullopt;
}

HttpRequest StoreSession::request(std::string method, Url url) {
    HttpRequest r;
    r.method = std::move(method);
    r.url = std::move(url);
    return r;
}

std::string StoreSession::pathOfHref(const std::string& href) {
    const auto url = href.starts_with('/') ? std::nullopt : Url::parse(href);
    const bool isPlain = url && href.find_first_of("?#") == std::string::npos;
    return isPlain ? url->encodedPath() : href;
}

HttpRequest StoreSession::propfind(Url url, int depth, bool withMembersTags) {
    HttpRequest r = request("PROPFIND", std::move(url));
    r.headers = {{"Depth", std::to_string(depth)}, {"Content-Type", "application/xml; charset=utf-8"}};
    r.body = propfindBody(withMembersTags);
    return r;
}

std::optional<std::string> StoreSession::password() {
    Lock lock(_mutex);
    if (!_password || _loginRefused) {
        try {
            _password = _account.password();
        } catch (const CXException& e) {
            _password.reset();
            lock.unlock();
            CXLog("%@", e.reason());
            CXFileManager::failedToGetPassword();
            return std::nullopt;
        }
    }
    return _password;
}

// Hands the credentials to the transport on first need. False when there should be some and cannot be had.
bool StoreSession::signIn() {
    if (!_signsIn || _signedIn) return true;
    if (_account.passwordSource.kind != PasswordSource::Kind::none) {
        const auto secret = password();
        if (!secret) return false;
        _signsIn->setCredentials(
            TransportCredentials{_account.user.str(), *secret, _account.origins(), schemeOf(_account.authentication)});
    }
    _signedIn = true;
    return true;
}

HttpResponse StoreSession::timed(HttpRequest request) {
    const auto began = std::chrono::steady_clock::now();
    HttpResponse answer = _transport->perform(std::move(request));
    if (answer.complete()) _distance.answered(std::chrono::steady_clock::now() - began);
    return answer;
}

HttpResponse StoreSession::performed(HttpRequest request) {
    const HttpRequest asked = request;
    return followed(asked, timed(std::move(request)));
}

HttpResponse StoreSession::followed(const HttpRequest& asked, HttpResponse answer) {
    const auto place = asked.tellsKind ? std::nullopt : redirectToCollection(asked.url, answer);
    return place ? _transport->perform(sentTo(asked, *place)) : answer;
}

HttpResponse StoreSession::believed(const HttpRequest& asked, HttpResponse answer) {
    if (answer.status == 401) {
        Lock guard(_mutex);
        _loginRefused = true;
        _loginProven = false;
    }
    if (isLeftOut("5xx") && answer.status >= 500) answer.status = asked.method == "PUT" ? 201 : 204;
    bool isBelieved = true;
    switch (verdictOn(asked.method, answer)) {
    case AnswerVerdict::success:
    case AnswerVerdict::failure: break;
    case AnswerVerdict::graveRefusal: isBelieved = provesItself(); break;
    case AnswerVerdict::refusal: isBelieved = isDavServer(); break;
    case AnswerVerdict::needsProof: isBelieved = isProven(asked); break;
    case AnswerVerdict::foreign: isBelieved = false; break;
    }
    if (isBelieved) return asStandard(asked.method, std::move(answer));
    _davSeen = 0; // it may have been one until now
    HttpResponse unbelieved;
    unbelieved.error = TransportError::unreachable;
    unbelieved.detail = "Whoever answered is not a WebDAV server, or did not do it: " + accountOf(asked.method, answer);
    return unbelieved;
}

// The server shows anew that it is a WebDAV server, and that it has done what it says.
bool StoreSession::isProven(const HttpRequest& asked) {
    return isLeftOut("proof") || (provesItself() && hasDone(asked));
}

bool StoreSession::hasDone(const HttpRequest& asked) {
    const auto look = [&](HttpRequest looking) { return performed(std::move(looking)); };
    if (asked.method == "PUT") {
        const HttpResponse there = look(request("GET", asked.url));
        return there.status == 200 && asked.body && there.body == *asked.body;
    }
    if (asked.method == "DELETE") return look(propfind(asked.url, 0)).status == 404;
    if (asked.method == "MKCOL") {
        const HttpResponse there = look(propfind(asked.url, 0));
        MultistatusReader reader;
        const auto entries = there.status == 207 && reader.feed(there.body) ? reader.finish() : std::nullopt;
        return entries && entries->size() == 1 && entries->front().isCollection;
    }
    if (asked.method == "UNLOCK") {
        HttpRequest looking = propfind(asked.url, 0);
        looking.body = lockdiscoveryBody();
        const HttpResponse there = look(std::move(looking));
        const auto token = std::find_if(asked.headers.begin(), asked.headers.end(),
                                        [](const auto& header) { return header.first == "Lock-Token"; });
        if (there.status == 404) return true;
        if (there.status != 207 || token == asked.headers.end() || token->second.size() < 3) return false;
        return there.body.find(token->second.substr(1, token->second.size() - 2)) == std::string::npos;
    }
    return true; // it has only been asked for something
}

HttpResponse StoreSession::judged(const HttpRequest& asked, HttpResponse answer, Handled handled) {
    signOfLife();
    HttpResponse heeded = believed(asked, followed(asked, std::move(answer)));
    const bool succeeded = heeded.ok() || (heeded.status == 207 && asked.method == "PROPFIND");
    if (!succeeded && !(heeded.complete() && handled && handled(heeded.status)))
        noteFailure(asked.method, asked.url, heeded);
    return heeded;
}

void StoreSession::noteFailure(std::string_view method, const Url& url, const HttpResponse& answer) {
    _failures.note(std::string(method), nameFor(url.absoluteString()).value_or(url), answer);
}

HttpResponse StoreSession::send(HttpRequest request, Handled handled) {
    const HttpRequest asked = request;
    return judged(asked, signIn() ? timed(std::move(request)) : unsent(), handled);
}

HttpResponse StoreSession::sendUnnoted(HttpRequest request) {
    const HttpRequest asked = request;
    return believed(asked, signIn() ? performed(std::move(request)) : unsent());
}

std::vector<HttpResponse> StoreSession::sendAll(std::vector<HttpRequest> requests, Handled handled) {
    const std::vector<HttpRequest> asked = requests;
    const bool isSignedIn = signIn();
    const auto began = std::chrono::steady_clock::now();
    auto answers =
        isSignedIn ? _transport->performAll(std::move(requests)) : std::vector<HttpResponse>(requests.size(), unsent());
    if (!answers.empty() && answers.front().complete()) _distance.answered(std::chrono::steady_clock::now() - began);
    for (size_t i = 0; i < answers.size(); ++i) answers[i] = judged(asked[i], std::move(answers[i]), handled);
    return answers;
}

void StoreSession::start(HttpRequest request, HttpTransport::Completion done) {
    if (!signIn()) return done(unsent());
    _transport->start(std::move(request),
                      [this, began = std::chrono::steady_clock::now(), done = std::move(done)](HttpResponse answer) {
                          if (answer.complete()) _distance.answered(std::chrono::steady_clock::now() - began);
                          done(std::move(answer));
                      });
}

HttpResponse StoreSession::options() {
    return optionsAndMore({}).front();
}

// The answers to an OPTIONS of the account's tree, which is heeded, and to the requests, sent with it.
std::vector<HttpResponse> StoreSession::optionsAndMore(std::vector<HttpRequest> requests) {
    const auto base = collectionEndpoint(_account.baseLocationFor(_account.user));
    if (!base) return std::vector<HttpResponse>(requests.size() + 1);
    HttpRequest r = request("OPTIONS", *base);
    r.limits = kOptionsLimits;
    requests.insert(requests.begin(), std::move(r));
    const std::vector<HttpRequest> asked = requests;
    const bool isKnownToHang = steadyMilliseconds() < _hangsUntil;
    if (isKnownToHang) requests.erase(requests.begin());
    std::vector<HttpResponse> answers = _transport->performAll(std::move(requests));
    if (isKnownToHang) {
        HttpResponse none;
        none.error = TransportError::timedOut;
        answers.insert(answers.begin(), std::move(none));
    }
    for (size_t i = 0; i < answers.size(); ++i) answers[i] = followed(asked[i], std::move(answers[i]));
    answers.front() = optionsAbove(std::move(answers.front()));
    if (!heedOptions(answers.front()) && answers.front().status != 401) _davSeen = 0;
    return answers;
}

bool StoreSession::heedOptions(const HttpResponse& answer) {
    const bool isHeeded = answer.ok() || answer.status == 403 || answer.status == 404;
    if (!answer.complete() || !isHeeded || !announcesDav(answer)) return false;
    _davSeen = steadyMilliseconds();
    _accessLists = announcesDavClass(answer, "access-control") ? 1 : 0;
    _membersTags = announcesDavClass(answer, kMembersTagClass);
    _syncs = announcesDavClass(answer, kSyncClass);
    _mayKeepLocks = announcesDavClass(answer, "2");
    heedNews(answer);
    return true;
}

// "Rolvane-News: /dav/ 0123456789abcdef": a path of the same origin, and the position of this moment.
void StoreSession::heedNews(const HttpResponse& answer) {
    constexpr size_t kLongest = 2000;
    const std::string* offered = answer.header("rolvane-news");
    const size_t blank = offered ? offered->find(' ') : std::string::npos;
    const auto base = collectionEndpoint(_account.baseLocationFor(_account.user));
    const Lock guard(_mutex);
    const bool isUsable = blank != std::string::npos && offered->size() <= kLongest && offered->starts_with('/') &&
                          !offered->starts_with("//") && base;
    if (!isUsable) {
        _news.reset();
        return;
    }
    const std::string first = _news ? _news->firstPosition : offered->substr(blank + 1);
    _news = {Url(base->origin() + offered->substr(0, blank)), first};
}

std::optional<StoreSession::NewsOffer> StoreSession::newsOffer() {
    const Lock guard(_mutex);
    return _news;
}

std::unique_ptr<CurlTransport> StoreSession::transportOfItsOwn() {
    CurlTransportOptions options = transportOptions(_account);
    options.http2 = false;
    options.maxConnections = 1;
    options.maxRetryAfterSeconds = 0;
    auto transport = std::make_unique<CurlTransport>(std::move(options));
    if (_account.passwordSource.kind == PasswordSource::Kind::none) return transport;
    const auto secret = password();
    if (!secret) return nullptr;
    transport->setCredentials(
        TransportCredentials{_account.user.str(), *secret, _account.origins(), schemeOf(_account.authentication)});
    return transport;
}

// A tree that is not there yet: some servers refuse its OPTIONS, or never answer them. Then the next collection above
// that is there is asked. The answer to go by.
HttpResponse StoreSession::optionsAbove(HttpResponse ofTheTree) {
    const bool isRefused = verdictOn("OPTIONS", ofTheTree) == AnswerVerdict::refusal && !announcesDav(ofTheTree);
    if (!isRefused && ofTheTree.error != TransportError::timedOut) {
        _hangsUntil = 0;
        return ofTheTree;
    }
    Url above = *endpoint(_account.baseLocationFor(_account.user));
    while (above.pathComponents().size() > 1) {
        above = above.cxURLByDeletingLastComponent();
        HttpRequest looking = propfind(namedAsCollection(above), 0);
        looking.limits = kOptionsLimits;
        const int found = performed(std::move(looking)).status;
        if (found == 404) continue;
        if (found == 0 || found == 401) break; // nothing better comes of asking on
        HttpRequest asking = request("OPTIONS", namedAsCollection(above));
        asking.limits = kOptionsLimits;
        HttpResponse answer = performed(std::move(asking));
        if (verdictOn("OPTIONS", answer) != AnswerVerdict::success) break;
        if (!isRefused && steadyMilliseconds() >= _hangsUntil) _hangsUntil = steadyMilliseconds() + kHangMilliseconds;
        return answer;
    }
    _hangsUntil = 0;
    return ofTheTree;
}

std::optional<bool> StoreSession::keepsAccessLists() {
    if (_accessLists < 0 && signIn()) options();
    const int kept = _accessLists;
    return kept < 0 ? std::nullopt : std::optional(kept == 1);
}

bool StoreSession::provesItself() {
    if (!signIn()) return false;
    options();
    return _davSeen != 0;
}

bool StoreSession::isDavServer() {
    const auto recent = [this] {
        const int64_t seen = _davSeen;
        return seen != 0 && steadyMilliseconds() - seen < kBeliefMilliseconds;
    };
    if (recent()) return true;
    options();
    return recent();
}

CXDAVError StoreSession::errorFrom(const HttpResponse& answer, const char* asked) const {
    const std::string where = _account.origins().empty() ? "the store" : _account.origins().front();
    if (answer.error == TransportError::timedOut)
        return {kCXDAVErrorTimedOut, where + " did not answer in time. It is tried again later."};
    if (answer.error == TransportError::tls)
        return {kCXDAVErrorSecureConnection, "No secure connection to " + where + ": " + answer.detail +
                                                 ". Check the account's authority file and host name."};
    if (!answer.complete())
        return {kCXDAVErrorCannotConnect,
                where + " cannot be reached: " + answer.detail + ". It is tried again later."};
    if (answer.status == 401)
        return {kCXDAVErrorAuthentication, where + " refused the user name or the password of \"" +
                                               _account.user.str() + "\". Correct the account."};
    if (answer.status >= 300 && answer.status < 400 && answer.header("location"))
        return {kCXDAVErrorBadServerResponse, where + " sends " + asked + " to " + *answer.header("location") +
                                                  ", where nothing was sent. Check the account's endpoint."};
    return {kCXDAVErrorBadServerResponse, where + " answered " + asked + " with " + std::to_string(answer.status) +
                                              " and is no WebDAV server. Check the account's endpoint."};
}

bool StoreSession::canReach(CXDAVError& error, const std::function<void()>& meanwhile) {
    error = {};
    bool needsLoginProof;
    {
        Lock guard(_mutex);
        if (_loginRefused) _signedIn = false; // the password may have been corrected meanwhile
        needsLoginProof = !_loginProven;
    }
    if (!signIn()) {
        error = {kCXDAVErrorNoPassword, "The password of the account cannot be had."};
        return false;
    }
    if (meanwhile) meanwhile();
    // Servers may answer OPTIONS without looking at the login, so the login is proven once by a request that needs it.
    std::vector<HttpRequest> proof;
    if (const auto tree = collectionEndpoint(_account.baseLocationFor(_account.user)); tree && needsLoginProof)
        proof.push_back(propfind(*tree, 0));
    const std::vector<HttpResponse> answers = optionsAndMore(std::move(proof));
    for (size_t i = 0; i < answers.size(); ++i) {
        const HttpResponse& answer = answers[i];
        // A refusal of the tree is no refusal of the login: whose tree it is nobody has said yet.
        const bool isForeign = i > 0 && verdictOn("PROPFIND", answer) == AnswerVerdict::foreign;
        if (answer.complete() && answer.status != 401 && !isForeign && _davSeen != 0) continue;
        const char* asked = i == 0 ? "OPTIONS" : "PROPFIND";
        error = errorFrom(answer, asked);
        noteFailure(asked, collectionEndpoint(_account.baseLocationFor(_account.user)).value_or(Url()), answer);
        Lock guard(_mutex);
        _loginRefused = _loginRefused || answer.status == 401;
        return false;
    }
    Lock guard(_mutex);
    _loginProven = true;
    _loginRefused = false;
    return true;
}

} // namespace rolvane
