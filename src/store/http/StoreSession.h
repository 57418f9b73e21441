#pragma once

#include "foundation/Mutex.h"
#include "store/account/Account.h"
#include "store/dav/CXDAVManager.h"
#include "store/http/HttpTransport.h"
#include "store/http/RequestFailures.h"
#include "store/http/StoreDistance.h"

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

class CurlTransport;

// Sends WebDAV requests for one account and judges the answers: who may be believed, and what the login is worth.
// Any thread.
class StoreSession {
public:
    StoreSession(CXDAVAccount account, std::shared_ptr<HttpTransport> transport, CurlTransport* signsIn);

    const CXDAVAccount& account() const { return _account; }
    HttpTransport& transport() { return *_transport; }

    // The endpoint of a name, or nothing.
    std::optional<Url> endpoint(const Url& name, bool securely = false) const;
    // The same of what is known to be a collection, with a slash at its end.
    std::optional<Url> collectionEndpoint(const Url& name, bool securely = false) const;
    // The name of an href, or nothing; both as CXDAVAccount's.
    std::optional<Url> nameFor(std::string_view href) const { return _map.nameFor(href); }

    // Which statuses, besides success, the caller handles: those answers are no failures of its operation.
    using Handled = bool (*)(int status);

    // Sends the request. What no WebDAV server answers (see ExpectedAnswer) is an `unreachable`. A refusal is believed
    // only of a server that has proven itself within half a minute, and a success that a portal gives, too, only when
    // the server has proven itself anew and shows what it has done. An answer that is neither success nor handled is
    // noted among the failures. A redirect to the same place with a slash is followed.
    HttpResponse send(HttpRequest request, Handled handled = nullptr);
    std::vector<HttpResponse> sendAll(std::vector<HttpRequest> requests, Handled handled = nullptr);
    // The same, and nothing is noted: whoever asks in more than one way notes the failure when all have failed.
    HttpResponse sendUnnoted(HttpRequest request);
    // Sends it and calls back with the answer as it came; whoever uses that has it judged then, on its own thread.
    void start(HttpRequest request, HttpTransport::Completion done);
    HttpResponse judged(const HttpRequest& asked, HttpResponse answer, Handled handled = nullptr);
    // Asks the server now whether it is a WebDAV server.
    bool provesItself();
    // An answer that was handled, and still made the caller's operation fail.
    void noteFailure(std::string_view method, const Url& url, const HttpResponse& answer);
    RequestFailures& failures() { return _failures; }

    // Whether the store can be used, see CXDAVManager::canReachOstrelError.
    bool canReach(CXDAVError& error, const std::function<void()>& meanwhile = {});
    // Whether the server announces access lists (RFC 3744 section 7.2), as it last said; asked when it never did.
    // Nothing when it does not answer.
    std::optional<bool> keepsAccessLists();
    // False when the server has said last that it keeps no locks: it announces class 1 without class 2 (RFC 4918
    // section 18). True as long as it has said nothing.
    bool mayKeepLocks() const { return _mayKeepLocks; }
    // Whether the server tells the state of a collection's members by a tag, as it last said: a property of that name
    // counts only where the server announces it, since elsewhere any writer could set it.
    bool givesMembersTags() const { return _membersTags; }
    // The same, or it has not been asked yet.
    bool mayGiveMembersTags() const { return _membersTags || _accessLists < 0; }
    bool hasAnswered() const { return _accessLists >= 0; } // to OPTIONS, in this process
    // Whether collections may be worth the question what has changed in them (RFC 6578), as the server last said.
    bool maySynchronize() const { return _syncs; }
    void doesNotSynchronize() { _syncs = false; } // until it says so again
    // Where the store tells news of trees to whoever waits, as it last said; nothing when it does not.
    struct NewsOffer {
        Url place;                 // on the account's own origin
        std::string firstPosition; // that it gave in this run: nothing was read before
    };
    std::optional<NewsOffer> newsOffer();
    // Another transport that signs in as this session does, over HTTP/1.1 and one connection; null when the password
    // cannot be had.
    std::unique_ptr<CurlTransport> transportOfItsOwn();
    // The password; absent, and the failed-password handler called, when it cannot be had.
    std::optional<std::string> password();

    static HttpRequest request(std::string method, Url url);
    // The path of an href that is a URL of its own: behind a proxy servers write another scheme, host or port than the
    // client's. Where nothing is sent, the path alone counts.
    static std::string pathOfHref(const std::string& href);
    static HttpRequest propfind(Url url, int depth, bool withMembersTags = false);

    bool isFar() const { return _distance.isFar(); } // by the answers so far

private:
    bool signIn();
    bool isDavServer();
    HttpResponse timed(HttpRequest request);
    HttpResponse performed(HttpRequest request);
    HttpResponse followed(const HttpRequest& asked, HttpResponse answer);
    HttpResponse believed(const HttpRequest& asked, HttpResponse answer);
    bool isProven(const HttpRequest& asked);
    bool hasDone(const HttpRequest& asked);
    HttpResponse options();
    HttpResponse optionsAbove(HttpResponse ofTheTree);
    bool heedOptions(const HttpResponse& answer);
    void heedNews(const HttpResponse& answer);
    std::vector<HttpResponse> optionsAndMore(std::vector<HttpRequest> requests);
    CXDAVError errorFrom(const HttpResponse& answer, const char* asked) const;

    const CXDAVAccount _account;
    const EndpointMap _map;
    const std::shared_ptr<HttpTransport> _transport;
    CurlTransport* const _signsIn; // gets the credentials; none when the transport has its own

    RequestFailures _failures;
    StoreDistance _distance;

    Mutex _mutex;
    std::optional<std::string> _password GUARDED_BY(_mutex);
    bool _loginRefused GUARDED_BY(_mutex) = false; // a 401 was seen: ask for the password anew
    std::optional<NewsOffer> _news GUARDED_BY(_mutex);
    bool _loginProven GUARDED_BY(_mutex) = false; // a request that needs a login has succeeded
    std::atomic<bool> _signedIn{false};
    std::atomic<bool> _membersTags{false};
    std::atomic<bool> _syncs{false};
    std::atomic<bool> _mayKeepLocks{true};
    std::atomic<int> _accessLists{-1};   // 1 or 0 as the server announced it last, -1: it never answered
    std::atomic<int64_t> _hangsUntil{0}; // steady milliseconds: OPTIONS of the tree were not answered, those above were
    std::atomic<int64_t> _davSeen{0}; // steady milliseconds when the server last proved to be a WebDAV server; 0: never
};

// Whether the answer's "DAV" headers name the compliance class (RFC 4918 section 10.1).
bool announcesDavClass(const HttpResponse& answer, std::string_view name);
// Upper and lower case are the same to it. "DAV: 1, 2" -> true, and so do 2 and 3 alone, which take in the first.
bool announcesDav(const HttpResponse& answer);

// The transport for an account over libcurl, without credentials yet.
std::unique_ptr<CurlTransport> makeAccountTransport(const CXDAVAccount& account);

} // namespace rolvane
