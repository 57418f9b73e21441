#include "store/StoreLock.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "store/CXDAVManagerImpl.h"

#include <algorithm>
#include <ctime>

namespace rolvane {

namespace {

std::string escaped(const std::string& text) {
    std::string out;
    for (const char c : text) {
        if (c == '&')
            out += "&amp;";
        else if (c == '<')
            out += "&lt;";
        else
            out += c;
    }
    return out;
}

std::string ownerOf(const UserName& user, const std::string& mark) {
    return mark.empty() ? user.str() : user.str() + " " + mark;
}

// Lock-Token: <urn:...> (RFC 4918 section 10.5)
LockToken tokenInHeader(const HttpResponse& answer) {
    const std::string* text = answer.header("lock-token");
    if (!text || text->size() < 3 || text->front() != '<' || text->back() != '>') return {};
    return LockToken(text->substr(1, text->size() - 2));
}

// True when the store has said that it knows the lock no more. A server in trouble, a refusal or somebody else's answer
// says nothing of it.
bool isGone(int status) {
    return status == 404 || status == 409 || status == 410 || status == 412;
}

// Who may not lock needs no lock, see tryLock.
bool isDenied(int status) {
    return status == 403;
}

double secondsSinceBoot() {
    timespec now{};
    ::clock_gettime(CLOCK_BOOTTIME, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

bool isPlausible(const LockToken& token) {
    return !token.empty() && token.str().size() < 1024 && token.str().find_first_of("<>\r\n ") == std::string::npos;
}

struct StandingLock {
    bool answered = false; // the store has said whether there is one
    std::optional<LockToken> ofAnEndedRun;
};

// Of a run that was killed before it could write the token down.
StandingLock lockThere(StoreSession& session, const Url& endpoint, const LockLedger& ledger) {
    HttpRequest r = StoreSession::request("PROPFIND", endpoint);
    r.headers = {{"Depth", "0"}, {"Content-Type", "application/xml; charset=utf-8"}};
    r.body = std::make_shared<const std::string>("<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<propfind xmlns=\"DAV:\">"
                                                 "<prop><lockdiscovery/></prop></propfind>");
    const HttpResponse answer = session.send(std::move(r), isGone);
    if (!answer.complete()) return {};
    if (answer.status != 207) return {isGone(answer.status) || answer.status == 403, std::nullopt};
    const auto lock = parseLockAnswer(answer.body);
    return {true, lock && ledger.isAnEndedRun(lock->owner) ? std::optional(lock->token) : std::nullopt};
}

// Whether the store knows the lock no more.
bool release(StoreSession& session, const Url& endpoint, const LockToken& token) {
    HttpRequest r = StoreSession::request("UNLOCK", endpoint);
    r.headers = {{"Lock-Token", "<" + token.str() + ">"}};
    const HttpResponse answer = session.send(std::move(r), isGone);
    return answer.ok() || isGone(answer.status);
}

} // namespace

StoreLock::StoreLock(std::shared_ptr<CXDAVManager::Impl> client, Url name, LockLedger ledger, const Clock& clock)
    : _client(client), _name(std::move(name)), _endpoint(client->session.endpoint(_name)), _ledger(std::move(ledger)),
      _clock(clock) {}

// A LOCK request: a new lock, or the refresh of the token's.
HttpResponse StoreLock::ask(const LockToken& refreshed) {
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
            escaped(ownerOf(client->session.account().user, _ledger.markOfThisRun())) + "</owner></lockinfo>");
    }
    return client->session.send(std::move(r), isDenied);
}

// Keeps what the answer grants; false when it grants nothing.
bool StoreLock::take(const HttpResponse& answer, const LockToken& known) {
    if (!answer.ok()) return false;
    const auto grant = parseLockAnswer(answer.body);
    if (!grant) return false;
    LockToken token = tokenInHeader(answer);
    if (token.empty()) token = known.empty() ? grant->token : known;
    if (!isPlausible(token)) return false;
    const double seconds = std::clamp(grant->timeoutSeconds.value_or(lockTimeout()), 1.0, 86400.0);
    {
        std::lock_guard guard(_mutex);
        _token = token;
        _ends = secondsSinceBoot() + seconds;
    }
    if (const auto client = _client.lock()) client->tokens.set(_endpoint->absoluteString(), token);
    return true;
}

// Unless it is gone the lock may still stand on the store: its token is kept for whoever asks next, the next run
// included.
void StoreLock::lose(bool gone) {
    LockToken token;
    {
        std::lock_guard guard(_mutex);
        std::swap(token, _token);
    }
    if (token.empty() || !_endpoint) return;
    const std::string where = _endpoint->absoluteString();
    if (const auto client = _client.lock())
        gone ? client->tokens.drop(where, token) : client->tokens.abandon(where, token);
    if (gone) _ledger.strike(where);
}

// Of a lock that stands on the store: perhaps it is ours, let go of without the store's hearing of it, or that of an
// earlier run that did not come to release it.
bool StoreLock::takeOver(const std::optional<LockToken>& orphan) {
    const auto client = _client.lock();
    if (!client) return false;
    const LockToken abandoned = client->tokens.abandonedFor(_endpoint->absoluteString());
    if (isPlausible(abandoned) && take(ask(abandoned), abandoned)) return true;
    const auto takeOverThe = [this](const std::optional<LockToken>& ended) {
        if (!ended || !isPlausible(*ended) || !take(ask(*ended), *ended)) return false;
        CXDLog("Took over the lock on %@ of an earlier run", _name);
        return true;
    };
    return takeOverThe(orphan) || takeOverThe(lockThere(client->session, *_endpoint, _ledger).ofAnEndedRun);
}

bool StoreLock::tryLock() {
    std::lock_guard calls(_calls);
    if (locked()) return true;
    if (!_endpoint) return false;
    const std::string where = _endpoint->absoluteString();
    const auto orphan = _ledger.orphan(where);
    const bool expected = _ledger.expect(where);
    const HttpResponse answer = ask({});
    // Who may not lock may not write either, and the write is what says so: there is nothing to keep apart from others.
    const bool needsNone = answer.complete() && answer.status == 403;
    if (needsNone || !(answer.status == 423 ? takeOver(orphan) : take(answer, {}))) {
        if (expected && answer.complete()) _ledger.strike(where);
        return needsNone;
    }
    LockToken token;
    {
        std::lock_guard guard(_mutex);
        token = _token;
    }
    _ledger.note(where, token);
    return true;
}

bool StoreLock::renew() {
    std::lock_guard calls(_calls);
    LockToken token;
    {
        std::lock_guard guard(_mutex);
        token = _token;
    }
    if (token.empty()) return false;
    const HttpResponse answer = ask(token);
    if (take(answer, token)) return true;
    lose(isGone(answer.status));
    return false;
}

void StoreLock::unlock() {
    std::lock_guard calls(_calls);
    LockToken token;
    {
        std::lock_guard guard(_mutex);
        token = _token;
    }
    if (token.empty()) return;
    bool gone = false;
    if (const auto client = _client.lock()) gone = release(client->session, *_endpoint, token);
    lose(gone);
}

bool StoreLock::locked() const {
    std::lock_guard guard(_mutex);
    return !_token.empty();
}

Date StoreLock::expires() const {
    std::lock_guard guard(_mutex);
    return _clock.now().addingSeconds(_token.empty() ? lockTimeout() : _ends - secondsSinceBoot());
}

std::shared_ptr<CXWebDAVLock> makeStoreLock(CXDAVManager& manager, const Url& url) {
    return std::make_shared<StoreLock>(manager.impl(), url, LockLedger::user());
}

void releaseLocksOfEndedRuns(CXDAVManager& manager) {
    LockLedger ledger = LockLedger::user();
    StoreSession& session = manager.impl()->session;
    for (const LockLedger::Left& left : ledger.leftByEndedRuns()) {
        if (!session.nameFor(left.url)) continue; // another account's
        const Url endpoint(left.url);
        std::optional<LockToken> token = left.token;
        if (!isPlausible(*token)) {
            const StandingLock standing = lockThere(session, endpoint, ledger);
            token = standing.ofAnEndedRun;
            if (standing.answered && !token) ledger.strike(left.url);
        }
        if (!token || !release(session, endpoint, *token)) continue;
        ledger.strike(left.url);
        CXDLog("Released the lock on %@ of an earlier run", left.url);
    }
}

std::shared_ptr<CXWebDAVLock> CXWebDAVLock::initWithURL(const Url& url) {
    if (url.scheme() == "file") return makeFileLock(url);
    return makeStoreLock(CXDAVManager::defaultManager(), url);
}

} // namespace rolvane
