#include "store/StoreLock.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Paths.h"
#include "store/CXDAVManagerImpl.h"

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <ctime>
#include <filesystem>
#include <map>
#include <unistd.h>

namespace rolvane {

// ---- ledger

LockLedger LockLedger::user() {
    try {
        return LockLedger(stateDirectory() + "/locks");
    } catch (const CXException& e) {
        CXLog("Lock tokens are not written down: %@", e.reason());
        return LockLedger("");
    }
}

std::string LockLedger::pathFor(const std::string& url) const {
    uint64_t h = 0xcbf29ce484222325u;
    for (const char c : url) h = (h ^ static_cast<unsigned char>(c)) * 0x100000001b3u;
    char name[32];
    snprintf(name, sizeof name, "/%016llx", static_cast<unsigned long long>(h));
    return _directory + name;
}

namespace {

// When the process was started, in the kernel's ticks (field 22 of its stat file); "" when there is no such process.
// Together with the id it names a process for good.
std::string startOfProcess(const std::string& pid) {
    try {
        const std::string text = readFile("/proc/" + pid + "/stat", 65536);
        size_t at = text.rfind(')');
        for (int field = 2; at != std::string::npos && field < 22; ++field) at = text.find(' ', at + 1);
        return at == std::string::npos ? "" : text.substr(at + 1, text.find(' ', at + 1) - at - 1);
    } catch (const CXException&) {
        return {};
    }
}

std::string thisProcess() {
    return std::to_string(getpid()) + " " + startOfProcess("self");
}

// Of what thisProcess() gave once.
bool isAlive(const std::string& process) {
    const size_t space = process.find(' ');
    return space != std::string::npos && startOfProcess(process.substr(0, space)) == process.substr(space + 1);
}

constexpr size_t kMarkLength = 36; // a UUID's

bool isAMark(const std::string& text) {
    return text.size() == kMarkLength && text.find_first_not_of("0123456789ABCDEFabcdef-") == std::string::npos;
}

// Marks of runs whose locks have all come to their end by now.
void removeOldRuns(const std::string& directory) {
    const auto old = std::filesystem::file_time_type::clock::now() -
                     std::chrono::duration_cast<std::chrono::seconds>(
                         std::chrono::duration<double>(2 * CXWebDAVLock::lockTimeout()));
    std::error_code failed;
    for (std::filesystem::directory_iterator run(directory, failed), end; !failed && run != end; run.increment(failed))
        try {
            std::error_code gone; // another program may be clearing up, too
            const auto written = run->last_write_time(gone);
            if (!gone && written < old && !isAlive(readFile(run->path(), 4096)))
                std::filesystem::remove(run->path(), gone);
        } catch (const CXException& e) {
            CXDLog("A run's file is left alone: %@", e.reason());
        }
}

} // namespace

std::string LockLedger::pathForRun(const std::string& mark) const {
    return _directory + "-runs/" + mark;
}

std::string LockLedger::markOfThisRun() const {
    static std::mutex mutex;
    static std::map<std::pair<pid_t, std::string>, std::string> marks; // of a process that forked, too
    if (_directory.empty()) return {};
    const std::lock_guard guard(mutex);
    std::string& mark = marks[{getpid(), _directory}];
    if (!mark.empty() && access(pathForRun(mark).c_str(), R_OK) == 0) return mark;
    try {
        CXPathUtils_MakeCompletePath(_directory + "-runs", 0700);
        removeOldRuns(_directory + "-runs");
        mark = makeUUID();
        writeFileDurably(pathForRun(mark), thisProcess());
    } catch (const CXException& e) {
        CXDLog("A lock is not marked: %@", e.reason());
        mark.clear();
    }
    return mark;
}

bool LockLedger::isOfAnEndedRun(const std::string& mark) const {
    if (_directory.empty() || !isAMark(mark) || access(pathForRun(mark).c_str(), R_OK) != 0) return false;
    try {
        return !isAlive(readFile(pathForRun(mark), 4096));
    } catch (const CXException&) {
        return false;
    }
}

// The file: process id and start, URL and token, a line each.
void LockLedger::note(const std::string& url, const LockToken& token) {
    if (_directory.empty()) return;
    try {
        CXPathUtils_MakeCompletePath(_directory, 0700);
        writeFileDurably(pathFor(url), thisProcess() + "\n" + url + "\n" + token.str() + "\n");
    } catch (const CXException& e) {
        CXDLog("A lock token is not written down: %@", e.reason());
    }
}

void LockLedger::strike(const std::string& url) {
    if (!_directory.empty()) ::unlink(pathFor(url).c_str());
}

std::optional<LockToken> LockLedger::orphan(const std::string& url) const {
    if (_directory.empty()) return std::nullopt;
    const std::string path = pathFor(url);
    if (access(path.c_str(), R_OK) != 0) return std::nullopt;
    try {
        const std::string text = readFile(path, 16384);
        const size_t first = text.find('\n'), second = text.find('\n', first + 1), third = text.find('\n', second + 1);
        if (third == std::string::npos || text.substr(first + 1, second - first - 1) != url) return std::nullopt;
        const std::string process = text.substr(0, first);
        if (process.find(' ') == std::string::npos || isAlive(process)) return std::nullopt;
        return LockToken(text.substr(second + 1, third - second - 1));
    } catch (const CXException&) {
        return std::nullopt;
    }
}

// ---- lock

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

// Lock-Token: <urn:...> (RFC 4918 section 10.5)
LockToken tokenInHeader(const HttpResponse& answer) {
    const std::string* text = answer.header("lock-token");
    if (!text || text->size() < 3 || text->front() != '<' || text->back() != '>') return {};
    return LockToken(text->substr(1, text->size() - 2));
}

// True when the store has said that it knows the lock no more. A server in trouble, a refusal or somebody else's answer
// says nothing of it.
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
            escaped(client->session.account().user.str() + " " + _ledger.markOfThisRun()) + "</owner></lockinfo>");
    }
    return client->session.send(std::move(r));
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
bool StoreLock::takeOver() {
    const auto client = _client.lock();
    const std::string where = _endpoint->absoluteString();
    const LockToken abandoned = client ? client->tokens.abandonedFor(where) : LockToken();
    if (isPlausible(abandoned) && take(ask(abandoned), abandoned)) return true;
    const auto takeOverThe = [this](const std::optional<LockToken>& orphan) {
        if (!orphan || !isPlausible(*orphan) || !take(ask(*orphan), *orphan)) return false;
        CXDLog("Took over the lock on %@ of an earlier run", _name);
        return true;
    };
    return takeOverThe(_ledger.orphan(where)) || takeOverThe(tokenOfAnEndedRun());
}

// Of a run that was killed before it could write the token down.
std::optional<LockToken> StoreLock::tokenOfAnEndedRun() {
    const auto client = _client.lock();
    if (!client) return std::nullopt;
    HttpRequest r = StoreSession::request("PROPFIND", *_endpoint);
    r.headers = {{"Depth", "0"}, {"Content-Type", "application/xml; charset=utf-8"}};
    r.body = std::make_shared<const std::string>("<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<propfind xmlns=\"DAV:\">"
                                                 "<prop><lockdiscovery/></prop></propfind>");
    const HttpResponse answer = client->session.send(std::move(r));
    const auto lock = answer.complete() && answer.status == 207 ? parseLockAnswer(answer.body) : std::nullopt;
    if (!lock || lock->owner.size() < kMarkLength) return std::nullopt;
    if (!_ledger.isOfAnEndedRun(lock->owner.substr(lock->owner.size() - kMarkLength))) return std::nullopt;
    return lock->token;
}

bool StoreLock::tryLock() {
    std::lock_guard calls(_calls);
    if (locked()) return true;
    if (!_endpoint) return false;
    const std::string where = _endpoint->absoluteString();
    const HttpResponse answer = ask({});
    // Who may not lock may not write either, and the write is what says so: there is nothing to keep apart from others.
    if (answer.complete() && answer.status == 403) return true;
    if (!(answer.status == 423 ? takeOver() : take(answer, {}))) return false;
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
    lose(isGone(answer));
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
    if (const auto client = _client.lock()) {
        HttpRequest r = StoreSession::request("UNLOCK", *_endpoint);
        r.headers = {{"Lock-Token", "<" + token.str() + ">"}};
        const HttpResponse answer = client->session.send(std::move(r));
        gone = answer.ok() || isGone(answer);
    }
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

std::shared_ptr<CXWebDAVLock> CXWebDAVLock::initWithURL(const Url& url) {
    if (url.scheme() == "file") return makeFileLock(url);
    return makeStoreLock(CXDAVManager::defaultManager(), url);
}

} // namespace rolvane
