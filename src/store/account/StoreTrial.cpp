#include "store/account/StoreTrial.h"

#include "foundation/Paths.h"
#include "foundation/PropertyList.h"
#include "store/dav/CXDAVManagerImpl.h"
#include "store/dav/Collections.h"

#include <memory>
#include <utility>
#include <vector>

namespace rolvane {

namespace {

bool isAny(int) {
    return true;
}

// Whether a refusal says how the store is. The others may be over in a moment: a server in trouble, a full disk,
// somebody else's lock.
bool isLasting(int status) {
    switch (status) {
    case 408:
    case 423:
    case 425:
    case 429: return false;
    case 501:
    case 505: return true;
    default: return status >= 400 && status < 500;
    }
}

// One trial, step by step; what it made goes with it.
class Trial {
public:
    explicit Trial(CXDAVManager::Impl& client) : _session(client.session) {}
    ~Trial() {
        for (auto made = _made.rbegin(); made != _made.rend(); ++made)
            if (*made == _folder || holdsNothing(*made)) (void)ask("DELETE", *made);
    }
    Trial(const Trial&) = delete;
    Trial& operator=(const Trial&) = delete;

    StoreTrial run() {
        _found.accessLists = _session.keepsAccessLists().value_or(false);
        if (makesFolders() && takesFiles() && readsAndLists()) {
            if (triesLocks() && changes()) deletes();
        }
        return _found;
    }

private:
    using Remedy = StoreTrial::Hindrance::Remedy;
    using Headers = std::vector<std::pair<std::string, std::string>>;

    HttpResponse ask(const char* method, const Url& url, Headers headers = {}, const std::string& body = {}) {
        HttpRequest request = StoreSession::request(method, url);
        request.headers = std::move(headers);
        if (!body.empty()) request.body = std::make_shared<const std::string>(body);
        return _session.send(std::move(request), isAny);
    }
    HttpResponse put(const std::string& value, Headers headers = {}) {
        headers.emplace_back("Content-Type", "application/xml; charset=utf-8");
        return ask("PUT", _file, std::move(headers), PropertyList::toXML(Dictionary{{"Trial", value}}));
    }

    bool hindered(const std::string& what, const char* method, const HttpResponse& answer) {
        const std::string said = answer.complete()
                                     ? std::string(method) + " was answered with " + std::to_string(answer.status)
                                     : answer.detail;
        const std::string words = answer.complete() ? serverWords(answer) : std::string();
        const int status = answer.complete() ? answer.status : 0;
        const bool isDenied = status == 403 || status == 401;
        _found.hindrance = {what + " (" + said + (words.empty() ? "" : ": " + words) + ").", status, isLasting(status),
                            isDenied ? Remedy::rights : Remedy::endpoint};
        return false;
    }
    // A server for address books and calendars refuses other things as it refuses strangers: by 403, or 400.
    bool refused(const std::string& what, const char* method, const HttpResponse& answer) {
        const HttpResponse options = ask("OPTIONS", _made.empty() ? _tree : _made.front());
        const bool isForBooks =
            announcesDavClass(options, "addressbook") || announcesDavClass(options, "calendar-access");
        if (!isForBooks || !answer.complete() || !isLasting(answer.status)) return hindered(what, method, answer);
        hindered("The store takes no files of this kind: it is a server for address books or calendars", method,
                 answer);
        _found.hindrance->remedy = Remedy::endpoint;
        return false;
    }

    // Somebody who has put something there meanwhile keeps it: DELETE takes all that lies below.
    bool holdsNothing(const Url& folder) {
        const HttpResponse listed = _session.send(StoreSession::propfind(folder, 1), isAny);
        MultistatusReader reader;
        const auto entries = listed.status == 207 && reader.feed(listed.body) ? reader.finish() : std::nullopt;
        if (!entries || entries->size() > 1) return false;
        if (entries->empty()) return true;
        std::string href = Url::percentDecode(entries->front().href);
        if (href.ends_with('/')) href.pop_back();
        return entries->front().isCollection && href.ends_with("/" + folder.cxLastComponent());
    }

    // Some servers answer MKCOL of a folder that is there as if they had made it (rclone: 201). What was there before
    // is not the trial's, and stays.
    HttpResponse make(const Url& folder) {
        const bool wasMissing = _session.send(StoreSession::propfind(folder, 0), isAny).status == 404;
        HttpResponse made = ask("MKCOL", folder);
        if (made.ok() && wasMissing) _made.push_back(folder);
        return made;
    }

    bool makesFolders() {
        const CXDAVAccount& account = _session.account();
        const Url name = account.baseLocationFor(account.user);
        const Url tree = _tree = *_session.collectionEndpoint(name, true);
        HttpResponse made = make(tree);
        if (made.status == 409 || made.status == 404) { // the folders above it are missing
            std::vector<Url> above;
            for (Url u = tree.cxURLByDeletingLastComponent(); !u.cxLastComponent().empty();
                 u = u.cxURLByDeletingLastComponent())
                above.insert(above.begin(), namedAsCollection(u));
            for (const Url& u : above) (void)make(u);
            made = make(tree);
        }
        const Url folder = _folder = namedAsCollection(tree.cxURLByAppendingComponent("trial-" + makeUUID()));
        made = ask("MKCOL", folder);
        if (!made.ok()) return refused("The store makes no folders", "MKCOL", made);
        _made.push_back(folder);
        _file = folder.cxURLByAppendingComponent(makeUUID() + ":CXPerson");
        return true;
    }

    bool takesFiles() {
        const HttpResponse written = put("first");
        return written.ok() || refused("The store takes no files of this kind", "PUT", written);
    }

    bool readsAndLists() {
        const HttpResponse read = ask("GET", _file);
        if (read.status != 200 || read.body != PropertyList::toXML(Dictionary{{"Trial", "first"}}))
            return hindered("The store does not give back what was written", "GET", read);
        const HttpResponse listed = _session.send(StoreSession::propfind(_made.back(), 1), isAny);
        MultistatusReader reader;
        const auto entries = listed.status == 207 && reader.feed(listed.body) ? reader.finish() : std::nullopt;
        if (entries)
            for (const MultistatusEntry& entry : *entries) {
                if (entry.isCollection) continue;
                _found.dates = entry.lastModified.has_value();
                _found.tags = !entry.etag.empty();
                return true;
            }
        return hindered("The store does not list what was written", "PROPFIND", listed);
    }

    HttpResponse lock() {
        return ask("LOCK", _file,
                   {{"Depth", "0"}, {"Timeout", "Second-60"}, {"Content-Type", "application/xml; charset=utf-8"}},
                   "<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<lockinfo xmlns=\"DAV:\"><lockscope><exclusive/>"
                   "</lockscope><locktype><write/></locktype><owner>trial</owner></lockinfo>");
    }

    bool tellsLocks() {
        const HttpResponse answer =
            ask("PROPFIND", _file, {{"Depth", "0"}, {"Content-Type", "application/xml; charset=utf-8"}},
                "<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<propfind xmlns=\"DAV:\"><prop><lockdiscovery/></prop>"
                "</propfind>");
        const auto locks = answer.status == 207 ? parseLockDiscovery(answer.body) : std::nullopt;
        return locks && !locks->empty();
    }

    // False only where a lock stands behind an answer that does not grant one: then every lock is the last.
    bool triesLocks() {
        if (!_session.mayKeepLocks()) return true;
        const HttpResponse answer = lock();
        const auto grant = answer.ok() ? parseLockAnswer(answer.body) : std::nullopt;
        const std::string token = grant ? grant->token.str() : std::string();
        if (token.empty() || token.find_first_of("<>\r\n ") != std::string::npos) {
            if (answer.complete() && answer.status < 500 && !answer.ok()) return true;
            const HttpResponse second = lock();
            if (second.status != 423 || tellsLocks()) return true;
            hindered("The store locks files and does not tell their locks: what is locked stays so", "A second LOCK",
                     second);
            _found.hindrance->lasts = true;
            _found.hindrance->remedy = Remedy::locks;
            return false;
        }
        const bool written = put("locked", {{"If", "<" + _file.absoluteString() + "> (<" + token + ">)"}}).ok();
        const bool released = ask("UNLOCK", _file, {{"Lock-Token", "<" + token + ">"}}).ok();
        _found.locks = written && released;
        return true;
    }

    bool changes() {
        const HttpResponse changed = put("second");
        if (!changed.ok()) return hindered("The store does not let a file be changed", "PUT", changed);
        // Of a version that is not there any more.
        _found.conditions = put("third", {{"If-Match", "\"no-such-version\""}}).status == 412;
        return true;
    }

    void deletes() {
        const HttpResponse gone = ask("DELETE", _file);
        if (!gone.ok()) {
            hindered("The store does not let a file be deleted", "DELETE", gone);
            return;
        }
        const HttpResponse folder = ask("DELETE", _made.back());
        if (folder.ok())
            _made.pop_back();
        else
            hindered("The store does not let a folder be deleted", "DELETE", folder);
    }

    StoreSession& _session;
    StoreTrial _found;
    std::vector<Url> _made; // from the outside in
    Url _tree, _folder, _file;
};

} // namespace

StoreTrial tryStore(CXDAVManager& store) {
    return Trial(*store.impl()).run();
}

} // namespace rolvane
