#include "store/locks/StoreLock.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "foundation/Paths.h"
#include "store/dav/CXDAVManagerImpl.h"
#include "store/dav/CXDAVNode.h"
#include "store/dav/Collections.h"
#include "store/locks/LockAnswers.h"

#include <algorithm>
#include <ctime>
#include <utility>
#include <vector>

namespace rolvane {

namespace {

// The last word is the run's mark, see LockLedger.
std::string ownerOf(const UserName& user, const std::string& request, const std::string& run) {
    return user.str() + " " + request + (run.empty() ? "" : " " + run);
}

// Lock-Token: <urn:...> (RFC 4918 section 10.5)
LockToken tokenInHeader(const HttpResponse& answer) {
    const std::string* text = answer.header("lock-token");
    if (!text || text->size() < 3 || text->front() != '<' || text->back() != '>') return {};
    return LockToken(text->substr(1, text->size() - 2));
}

// True when the store says that it knows no such thing. A server in trouble, a refusal or somebody else's answer says
// nothing of it.
bool isGone(const HttpResponse& answer) {
    const int status = answer.complete() ? answer.status : 0;
    return status == 404 || status == 409 || status == 410 || status == 412;
}

double secondsSinceBoot() {
    timespec now{};
    ::clock_gettime(CLOCK_BOOTTIME, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

bool isPlausible(const LockToken& token) {
    return !token.empty() && token.str().size() < 1024 && token.str().find_first_of("<>\r\n ") == std::string::npos;
}

// What stands on a URL, as the store tells it.
struct StandingLocks {
    bool answered = false; // it has told
    bool isThere = false;  // there is something at the URL, and these are its
    std::vector<LockGrant> locks;
};

StandingLocks locksThere(StoreSession& session, const Url& endpoint) {
    HttpRequest r = StoreSession::request("PROPFIND", endpoint);
    r.headers = {{"Depth", "0"}, {"Content-Type", "application/xml; charset=utf-8"}};
    r.body = std::make_shared<const std::string>("<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<propfind xmlns=\"DAV:\">"
                                                 "<prop><lockdiscovery/></prop></propfind>");
    const HttpResponse answer = session.sendUnnoted(std::move(r));
    if (!answer.complete()) return {};
    if (answer.status != 207) return {isGone(answer) || answer.status == 403, false, {}};
    auto locks = parseLockDiscovery(answer.body);
    return locks ? StandingLocks{true, true, std::move(*locks)} : StandingLocks{};
}

// Of a run that was killed before it could write the token down.
std::optional<LockGrant> lockOfAnEndedRun(const StandingLocks& standing, const LockLedger& ledger) {
    for (const LockGrant& lock : standing.locks)
        if (isPlausible(lock.token) && ledger.isAnEndedRun(lock.owner)) return lock;
    return std::nullopt;
}

// Of a request of this client's whose answer it did not hear.
std::optional<LockGrant> unheardLock(const StandingLocks& standing, const LockTokens& tokens, const std::string& url) {
    for (const LockGrant& lock : standing.locks)
        if (isPlausible(lock.token) && tokens.isUnheard(url, lock.owner)) return lock;
    return std::nullopt;
}

// The store shows which locks stand there, and this one is not among them.
bool isNotThere(StoreSession& session, const Url& endpoint, const LockToken& token) {
    const StandingLocks standing = locksThere(session, endpoint);
    return standing.answered && std::none_of(standing.locks.begin(), standing.locks.end(),
                                             [&](const LockGrant& lock) { return lock.token == token; });
}

// The answer to a renewal says so, and a look as well: something in between may have answered, and a lock that stays is
// in everybody's way.
bool isGoneThere(StoreSession& session, const Url& endpoint, const LockToken& token, const HttpResponse& answer) {
    return isGone(answer) && isNotThere(session, endpoint, token);
}

// Whether the store knows the lock no more. Asked twice where no answer comes. A store may refuse to release what is
// gone with any error (httpd: 400), so a refusal is followed by a look.
bool release(StoreSession& session, const Url& endpoint, const LockToken& token) {
    HttpRequest r = StoreSession::request("UNLOCK", endpoint);
    r.headers = {{"Lock-Token", "<" + token.str() + ">"}};
    HttpResponse answer = session.sendUnnoted(r);
    if (!answer.complete()) answer = session.sendUnnoted(std::move(r));
    if (answer.ok()) return true;
    if (answer.complete() && isNotThere(session, endpoint, token)) return true;
    session.noteFailure("UNLOCK", endpoint, answer);
    return false;
}

// Gives back what the client may have on the store without holding it.
void releaseLeftBehind(CXDAVManager::Impl& client, const std::string& url, LockLedger& ledger) {
    const Url endpoint(url);
    LockToken token = client.tokens.abandonedFor(url);
    if (!isPlausible(token)) {
        const StandingLocks standing = locksThere(client.session, endpoint);
        if (!standing.answered) return;
        const auto lock = unheardLock(standing, client.tokens, url);
        client.tokens.lookedForUnheard(url);
        if (!lock) return ledger.strike(url);
        token = lock->token;
        client.tokens.abandon(url, token);
    }
    if (!release(client.session, endpoint, token)) return;
    client.tokens.forgetAbandoned(url);
    client.tokens.lookedForUnheard(url);
    ledger.strike(url);
    CXDLog("Released the lock on %@ that nobody here holds", url);
}

} // namespace

StoreLock::StoreLock(std::shared_ptr<CXDAVManager::Impl> client, Url name, LockLedger ledger, const Clock& clock)
    : _client(client), _name(std::move(name)),
      _endpoint(isAlwaysCollection(_name) ? client->session.collectionEndpoint(_name)
                                          : client->session.endpoint(_name)),
      _ledger(std::move(ledger)), _clock(clock) {}

// A LOCK request: a new lock whose owner carries the mark, or the refresh of the token's.
HttpResponse StoreLock::ask(const LockToken& refreshed, const std::string& mark) {
    const auto client = _client.lock();
    if (!client || !_endpoint) return {};
    HttpRequest r = StoreSession::request("LOCK", *_endpoint);
    r.headers = {{"Timeout", "Second-" + std::to_string(static_cast<int>(lockTimeout()))}};
    if (!refreshed.empty()) {
        r.headers.emplace_back("If", "(<" + refreshed.str() + ">)");
    } else {
        r.headers.emplace_back("Depth", "0");
        r.headers.emplace_back("Content-Type", "application/xml; charset=utf-8");
        r.body = std::make_shared<const std::string>(
            "<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<lockinfo xmlns=\"DAV:\"><lockscope><exclusive/></lockscope>"
            "<locktype><write/></locktype><owner>" +
            CXDAVNode::escaped(ownerOf(client->session.account().user, mark, _ledger.markOfThisRun())) +
            "</owner></lockinfo>");
    }
    return client->session.sendUnnoted(std::move(r));
}

// Keeps what the answer grants; false when it grants nothing.
bool StoreLock::take(const HttpResponse& answer, const LockToken& known) {
    if (!answer.ok()) return false;
    auto grant = parseLockAnswer(answer.body);
    if (!grant) return false;
    if (LockToken token = tokenInHeader(answer); !token.empty()) grant->token = std::move(token);
    if (grant->token.empty()) grant->token = known;
    return keep(*grant);
}

bool StoreLock::keep(const LockGrant& grant) {
    if (!isPlausible(grant.token)) return false;
    const double seconds = std::clamp(grant.timeoutSeconds.value_or(lockTimeout()), 1.0, 86400.0);
    {
        Lock guard(_mutex);
        _token = grant.token;
        _ends = secondsSinceBoot() + seconds;
    }
    if (const auto client = _client.lock()) client->tokens.set(_endpoint->absoluteString(), grant.token);
    return true;
}

// Unless it is gone the lock may still stand on the store: its token is kept for whoever asks next, the next run
// included.
void StoreLock::lose(bool gone) {
    LockToken token;
    {
        Lock guard(_mutex);
        std::swap(token, _token);
    }
    if (token.empty() || !_endpoint) return;
    const std::string where = _endpoint->absoluteString();
    if (const auto client = _client.lock())
        gone ? client->tokens.drop(where, token) : client->tokens.abandon(where, token);
    if (gone) _ledger.strike(where);
}

// Of a lock that stands on the store: perhaps it is ours, let go of without the store's hearing of it or granted
// without our hearing of it, or that of an earlier run that did not come to release it.
bool StoreLock::takeOver(CXDAVManager::Impl& client, const std::optional<LockToken>& orphan) {
    const std::string where = _endpoint->absoluteString();
    const LockToken abandoned = client.tokens.abandonedFor(where);
    if (isPlausible(abandoned)) {
        const HttpResponse answer = ask(abandoned);
        if (take(answer, abandoned)) return true;
        if (isGoneThere(client.session, *_endpoint, abandoned, answer)) client.tokens.forgetAbandoned(where);
    }
    const auto takeOverThe = [this](const LockToken& token, const char* whose) {
        if (!isPlausible(token) || !take(ask(token), token)) return false;
        CXDLog("Took over the lock on %@ of %s", _name, whose);
        return true;
    };
    if (orphan && takeOverThe(*orphan, "an earlier run")) return true;
    const StandingLocks standing = locksThere(client.session, *_endpoint);
    if (const auto own = unheardLock(standing, client.tokens, where)) {
        if (takeOverThe(own->token, "a request that was not answered")) return true;
        client.tokens.abandon(where, own->token);
        return false;
    }
    const auto ended = lockOfAnEndedRun(standing, _ledger);
    return ended && takeOverThe(ended->token, "an earlier run");
}

// What a lost answer or a server in trouble leaves open is looked for on the store at once: the lock may stand. Where
// none does, it is asked for once more, and who says the same of it a second time keeps no locks.
StoreLock::Had StoreLock::attempt(CXDAVManager::Impl& client, const std::optional<LockToken>& orphan) {
    const std::string where = _endpoint->absoluteString();
    int doubted = 0; // the status
    for (int turn = 0; turn < 2; ++turn) {
        const std::string mark = makeUUID();
        const HttpResponse answer = ask({}, mark);
        LockAnswer said = judgeLockAnswer(answer);
        if (answer.sentTwice && said == LockAnswer::notNow)
            said = LockAnswer::unheard; // the first one may have been carried out
        const auto failed = [&](Had how) {
            client.session.noteFailure("LOCK", *_endpoint, answer);
            return how;
        };
        switch (said) {
        case LockAnswer::granted:
            if (take(answer, {})) return Had::lock;
            break;
        case LockAnswer::held: // also where the transport has sent it a second time
            client.tokens.expectUnheard(where, mark);
            client.tokens.lookedForUnheard(where);
            return takeOver(client, orphan) ? Had::lock : failed(Had::none);
        case LockAnswer::notAllowed:
        case LockAnswer::impossible: return Had::noNeed;
        case LockAnswer::notNow: return failed(Had::none);
        case LockAnswer::unheard:
        case LockAnswer::doubtful: break;
        }
        client.tokens.expectUnheard(where, mark);
        const StandingLocks standing = locksThere(client.session, *_endpoint);
        if (!standing.answered) {
            // Neither body could be read, and the head of the answer may have brought a lock all the same.
            const LockToken token = tokenInHeader(answer);
            const bool isGivenBack = isPlausible(token) && release(client.session, *_endpoint, token);
            if (isGivenBack) client.tokens.lookedForUnheard(where);
            return failed(isGivenBack ? Had::none : Had::unknown);
        }
        client.tokens.lookedForUnheard(where);
        if (const auto own = unheardLock(standing, client.tokens, where); own && keep(*own)) return Had::lock;
        if (!standing.isThere || !standing.locks.empty()) return failed(Had::none);
        if (said == LockAnswer::doubtful && answer.status == std::exchange(doubted, answer.status)) {
            constexpr double kAskAgain = 600; // seconds
            client.tokens.needNone(where, secondsSinceBoot() + kAskAgain);
            return Had::noNeed;
        }
        if (turn > 0) failed(Had::none);
    }
    return Had::none;
}

bool StoreLock::tryLock() {
    Lock calls(_calls);
    if (locked()) return true;
    const auto client = _client.lock();
    if (!_endpoint || !client) return false;
    const std::string where = _endpoint->absoluteString();
    if (!client->session.mayKeepLocks() || client->tokens.needsNone(where, secondsSinceBoot())) return true;
    const auto orphan = _ledger.orphan(where);
    const bool expected = _ledger.expect(where);
    const Had had = attempt(*client, orphan);
    if (had == Had::lock) {
        LockToken token;
        {
            Lock guard(_mutex);
            token = _token;
        }
        _ledger.note(where, token);
        return true;
    }
    if (expected && had != Had::unknown) _ledger.strike(where);
    if (had == Had::noNeed) CXDLog("No lock can be had on %@; what is there is written without one", _name);
    return had == Had::noNeed;
}

// Asked twice where no answer comes, as `unlock` does.
bool StoreLock::renew() {
    Lock calls(_calls);
    LockToken token;
    {
        Lock guard(_mutex);
        token = _token;
    }
    if (token.empty()) return false;
    HttpResponse answer = ask(token);
    if (!answer.complete()) answer = ask(token);
    if (take(answer, token)) return true;
    const auto client = _client.lock();
    if (client) client->session.noteFailure("LOCK", *_endpoint, answer);
    lose(client && isGoneThere(client->session, *_endpoint, token, answer));
    return false;
}

void StoreLock::unlock() {
    Lock calls(_calls);
    LockToken token;
    {
        Lock guard(_mutex);
        token = _token;
    }
    const auto client = _client.lock();
    if (!token.empty()) {
        lose(client && release(client->session, *_endpoint, token));
    } else if (client && _endpoint && client->tokens.isLeftBehind(_endpoint->absoluteString())) {
        releaseLeftBehind(*client, _endpoint->absoluteString(), _ledger);
    }
}

bool StoreLock::locked() const {
    Lock guard(_mutex);
    return !_token.empty();
}

Date StoreLock::expires() const {
    Lock guard(_mutex);
    return _clock.now().addingSeconds(_token.empty() ? lockTimeout() : _ends - secondsSinceBoot());
}

std::shared_ptr<CXWebDAVLock> makeStoreLock(CXDAVManager& manager, const Url& url) {
    return std::make_shared<StoreLock>(manager.impl(), url, LockLedger::user());
}

void releaseLocksOfEndedRuns(CXDAVManager& manager) {
    LockLedger ledger = LockLedger::user();
    CXDAVManager::Impl& client = *manager.impl();
    for (const std::string& url : client.tokens.leftBehind()) releaseLeftBehind(client, url, ledger);
    for (const LockLedger::Left& left : ledger.leftByEndedRuns()) {
        if (!client.session.nameFor(left.url)) continue; // another account's
        const Url endpoint(left.url);
        std::optional<LockToken> token = left.token;
        if (!isPlausible(*token)) {
            const StandingLocks standing = locksThere(client.session, endpoint);
            const auto lock = lockOfAnEndedRun(standing, ledger);
            token = lock ? std::optional(lock->token) : std::nullopt;
            if (standing.answered && !token) ledger.strike(left.url);
        }
        if (!token || !release(client.session, endpoint, *token)) continue;
        ledger.strike(left.url);
        CXDLog("Released the lock on %@ of an earlier run", left.url);
    }
}

std::shared_ptr<CXWebDAVLock> CXWebDAVLock::initWithURL(const Url& url) {
    if (url.scheme() == "file") return makeFileLock(url);
    return makeStoreLock(CXDAVManager::defaultManager(), url);
}

} // namespace rolvane
