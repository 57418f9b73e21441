#include "store/files/StoreFiles.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "foundation/PropertyList.h"
#include "foundation/TestSwitch.h"
#include "store/dav/Collections.h"
#include "store/dav/Multistatus.h"

#include <atomic>
#include <map>

namespace rolvane {

namespace {

constexpr std::string_view kMakingSuffix = ".making";
// What is read here becomes part of larger values, which must still be shallow enough to be written.
constexpr PropertyListLimits kReadLimits{.maxDepth = 48};
constexpr size_t kMaxKnownCollections = 20000;
constexpr int kOk = 200;
constexpr int kNoContent = 204;

// The dictionary that a thread read last, and what its next write to the same place has to find there.
struct ReadMark {
    Url name, target;
    bool set = false;
    enum class State { unknown, absent, present } state = State::unknown;
    EntityTag etag;
};
thread_local std::map<uint64_t, ReadMark> lastReads; // by reader

ReadMark takeMark(uint64_t reader, const Url& name) {
    const auto found = lastReads.find(reader);
    if (found == lastReads.end()) return {};
    const ReadMark mark = std::move(found->second);
    lastReads.erase(found);
    return mark.name == name ? mark : ReadMark();
}

uint64_t nextReader() {
    static std::atomic<uint64_t> last{0};
    return ++last;
}

bool mayBeBoth(const Url& name) {
    return name.encodedPath().ends_with("CXGroup");
}

Url stateURL(const Url& collection) {
    return collection.cxURLByAppendingComponent(CXDAVManager::kStateName);
}

bool isHtml(const HttpResponse& answer) {
    const std::string* type = answer.header("content-type");
    return type && type->find("html") != std::string::npos;
}

std::optional<Date> dateIn(const HttpResponse& answer, const char* name) {
    const std::string* text = answer.header(name);
    return text ? Date::fromHTTP(*text) : std::nullopt;
}

FileVersion versionOf(const HttpResponse& answer) {
    FileVersion v;
    if (const std::string* tag = answer.header("etag")) v.etag = EntityTag(*tag);
    v.lastModified = dateIn(answer, "last-modified");
    v.size = answer.body.size();
    return v;
}

bool isOneVersion(const EntityTag& a, const EntityTag& b) {
    const auto opaque = [](const EntityTag& tag) {
        return std::string_view(tag.str()).substr(tag.str().starts_with("W/") ? 2 : 0);
    };
    return !a.empty() && opaque(a) == opaque(b);
}

// A condition on this resource and no other: a list without a tag would be asked of the parent folder too.
std::string taggedCondition(const Url& target, const std::string& state) {
    return "<" + target.absoluteString() + "> (" + state + ")";
}

// The headers that make a write depend on what was read. A weak tag cannot be used with If-Match (RFC 9110 section
// 13.1.1), but WebDAV's own If header compares weakly.
std::vector<std::pair<std::string, std::string>> conditions(const ReadMark& mark, const LockToken& token,
                                                            const Url& target) {
    std::vector<std::pair<std::string, std::string>> out;
    std::string state = token.empty() ? "" : "<" + token.str() + ">";
    if (mark.set && mark.state == ReadMark::State::absent && !isLeftOut("if-none-match"))
        out.emplace_back("If-None-Match", "*");
    if (mark.set && mark.state == ReadMark::State::present && !mark.etag.empty()) {
        if (mark.etag.str().starts_with("W/"))
            state += (state.empty() ? "[" : " [") + mark.etag.str() + "]";
        else
            out.emplace_back("If-Match", isLeftOut("if-match") ? "*" : mark.etag.str());
    }
    if (!state.empty()) out.emplace_back("If", taggedCondition(target, state));
    return out;
}

// What callers handle.
bool isAbsence(int status) {
    return status == 404;
}
bool isAbsenceOrDenial(int status) {
    return status == 404 || status == 403;
}
bool mayMeanACollection(int status) {
    return isAbsenceOrDenial(status) || status == 405 || (status >= 300 && status < 400);
}
// Of a collection named with its slash: where a file of the name lies, some servers find nothing, or nonsense, below
// it.
bool isInTheWay(int status) {
    return status == 400 || status == 404 || status == 405 || status == 409 || (status >= 300 && status < 400);
}
// To what was named as a collection and is none, or the other way round.
bool mayMeanAnother(int status) {
    return isInTheWay(status);
}
// That it does not hold, that it makes no sense, or that the server does not know its like.
bool mayMeanTheCondition(int status) {
    return status == 412 || status == 400 || status == 501;
}
bool isGoneOrChanged(int status) {
    return status == 404 || status == 412;
}
bool isAny(int) {
    return true;
}

std::string contentType(const std::string& text) {
    return text.starts_with("<?xml") ? "application/xml; charset=utf-8" : "text/plain; charset=utf-8";
}

} // namespace

StoreFiles::StoreFiles(StoreSession& session, LockTokens& tokens, VersionMemory& versions)
    : _session(session), _tokens(tokens), _versions(versions),
      _startReading([&session](HttpRequest request, HttpTransport::Completion done) {
          request.givesWay = !mayBeBoth(request.url); // groups are needed before any contact
          session.start(std::move(request), std::move(done));
      }),
      _early(_startReading), _ahead(_startReading), _reader(nextReader()) {}

bool StoreFiles::isReservedName(std::string_view name) {
    return name == CXDAVManager::kStateName || name.ends_with(kMakingSuffix);
}

bool StoreFiles::knownCollection(const Url& url) const {
    Lock guard(_mutex);
    return !_collections.empty() && _collections.contains(url.absoluteString());
}

Url StoreFiles::asKnown(const Url& url) const {
    return knownCollection(url) ? namedAsCollection(url) : url;
}

void StoreFiles::remember(const Url& url) {
    Lock guard(_mutex);
    if (_collections.size() >= kMaxKnownCollections) _collections.clear();
    _collections.insert(url.absoluteString());
}

void StoreFiles::forget(const Url& url) {
    Lock guard(_mutex);
    _collections.erase(url.absoluteString());
}

// ---- reading

StoreFiles::Fetched StoreFiles::fetch(const Url& url, bool mayBeCollection) {
    std::optional<HttpResponse> waiting = _early.take(url);
    if (!waiting) waiting = _ahead.take(url);
    const StoreSession::Handled handled = mayBeCollection ? mayMeanACollection : isAbsenceOrDenial;
    HttpRequest request = StoreSession::request("GET", url);
    request.tellsKind = mayBeCollection;
    HttpResponse answer =
        waiting ? _session.judged(request, std::move(*waiting), handled) : _session.send(std::move(request), handled);
    // httpd says 403 of a file that is replaced or removed while it is being opened, too: only what is said twice
    // counts.
    if (answer.status == 403 && !mayBeCollection) answer = _session.send(StoreSession::request("GET", url), isAbsence);
    Fetched out;
    out.code = answer.status;
    if (!answer.complete()) return out;
    if (answer.status == 404) {
        out.found = Found::absent;
    } else if (mayBeCollection && ((answer.status >= 300 && answer.status < 400) || answer.status == 403 ||
                                   answer.status == 405 || (answer.status == 200 && isHtml(answer)))) {
        out.found = Found::perhapsCollection;
    } else if (answer.status == 200) {
        out.version = versionOf(answer);
        out.isHtml = isHtml(answer);
        out.found = Found::noDictionary;
        try {
            const Value value = PropertyList::fromXML(answer.body, kReadLimits);
            if (const Dictionary* d = value.dictionaryIf()) {
                out.dictionary = *d;
                out.found = Found::dictionary;
            }
        } catch (const CXException& e) {
            out.reason = e.reason();
        }
    }
    return out;
}

// Looks at the path itself and into the collection that may be there, the likelier one first. `target` becomes the
// place that a following write has to go to.
StoreFiles::Fetched StoreFiles::fetchEither(const Url& url, Url& target) {
    const Url state = stateURL(url);
    const bool known = knownCollection(url);
    target = known ? state : url;
    Fetched first = fetch(target, !known);
    if (first.found != Found::absent && first.found != Found::perhapsCollection) return first;
    const Url other = known ? url : state;
    Fetched second = fetch(other, known);
    if (known) { // nothing inside the collection: either it holds no state yet, or it has given way to a file
        if (second.found == Found::dictionary || second.found == Found::noDictionary) {
            forget(url);
            target = url;
            return second;
        }
        if (second.found == Found::absent) forget(url);
        return second.found == Found::failed ? second : first;
    }
    if (second.found != Found::absent) {
        if (second.found != Found::failed) remember(url);
        target = state;
        return second;
    }
    if (first.found == Found::perhapsCollection) {
        const Kind kind = kindOf(url);
        if (kind == Kind::file) return fetch(url, false);
        if (kind == Kind::unknown) return first;
        if (kind == Kind::collection) {
            remember(url);
            target = state;
        }
    }
    return second;
}

// A group's state that is no dictionary may be replaced, its members with it, and a contact of that kind is not read
// again while it stays as it is. So that must not be the answer of a connection that was cut off: only what is read the
// same way twice counts.
StoreFiles::Fetched StoreFiles::confirmed(const Fetched& once, const Url& target) {
    Fetched again = fetch(target, false);
    const bool same = again.version.etag == once.version.etag && again.version.size == once.version.size;
    const bool isSure = same && _session.provesItself(); // a portal says the same to everything
    if (again.found == Found::noDictionary && !isSure) again.found = Found::failed;
    return again;
}

// Keeps what a following write of this thread has to find.
void StoreFiles::note(const Url& name, const Url& target, const Fetched& fetched) {
    ReadMark mark{name, target, true, ReadMark::State::unknown, fetched.version.etag};
    if (fetched.found == Found::absent) {
        mark.state = ReadMark::State::absent;
        _versions.forget(name.absoluteString());
        _copies.forget(name.absoluteString());
    } else if (fetched.found == Found::dictionary) {
        mark.state = ReadMark::State::present;
        _versions.read(name.absoluteString(), fetched.version);
        if (mayBeBoth(name)) _copies.keep(name.absoluteString(), *fetched.dictionary);
    } else if (fetched.found == Found::noDictionary) {
        CXLog("What lies at %@ is no dictionary and is left out. %@", target, fetched.reason);
        mark.state = ReadMark::State::present;
        // Nobody has learnt what a group says, so its version stays unseen. A contact of that kind is left out by
        // everybody, and reading it in every pass would tell nothing new; a login page tells nothing of the file.
        if (!mayBeBoth(name) && !fetched.isHtml) _versions.read(name.absoluteString(), fetched.version);
    }
    lastReads[_reader] = std::move(mark);
}

StoreFiles::Reading StoreFiles::read(const Url& name, bool securely) {
    lastReads.erase(_reader);
    if (mayBeBoth(name))
        if (auto unchanged = _copies.unchanged(name.absoluteString()))
            return {kOk, std::move(unchanged), true, {}, false};
    const auto url = _session.endpoint(name, securely);
    if (!url) return {0, std::nullopt, false, std::nullopt, true};
    Url target = *url;
    Fetched fetched = mayBeBoth(name) ? fetchEither(*url, target) : fetch(*url, false);
    if (fetched.found == Found::noDictionary) fetched = confirmed(fetched, target);
    const bool isKnown = fetched.found == Found::dictionary && _versions.knows(name.absoluteString(), fetched.version);
    note(name, target, fetched);
    const bool failed = fetched.found == Found::failed || fetched.found == Found::perhapsCollection;
    return {fetched.code, std::move(fetched.dictionary), isKnown, fetched.version.lastModified, failed};
}

void StoreFiles::expectAbsence(const Url& name, bool securely) {
    if (const auto url = _session.endpoint(name, securely))
        lastReads[_reader] = {name, *url, true, ReadMark::State::absent, {}};
}

void StoreFiles::expectReads(const std::vector<Url>& names, bool securely) {
    std::vector<Url> urls;
    urls.reserve(names.size());
    for (const Url& name : names) {
        const auto url = _session.endpoint(name, securely);
        if (!url) continue;
        Url place = mayBeBoth(name) && knownCollection(*url) ? stateURL(*url) : *url;
        if (!_early.claim(place)) urls.push_back(std::move(place));
    }
    _ahead.expect(urls);
}

void StoreFiles::expectSomeReads(const std::vector<Url>& names, bool securely) {
    std::vector<Url> urls;
    urls.reserve(names.size());
    for (const Url& name : names)
        if (auto url = _session.endpoint(name, securely)) urls.push_back(std::move(*url));
    _early.add(urls);
}

void StoreFiles::expectNoReads() {
    _early.clear();
    _ahead.expect({});
}

void StoreFiles::foundCollection(const Url& name) {
    if (const auto url = _session.endpoint(name)) remember(*url);
}

std::optional<Date> StoreFiles::modificationDate(const Url& name) {
    const auto url = _session.endpoint(name);
    if (!url) return std::nullopt;
    const Url target = mayBeBoth(name) && knownCollection(*url) ? stateURL(*url) : *url;
    const HttpResponse answer = _session.send(StoreSession::request("HEAD", target), isAny);
    if (answer.ok())
        if (const auto date = dateIn(answer, "last-modified")) return date;
    if (!answer.complete() || answer.status == 404) return std::nullopt;
    MultistatusReader reader;
    const HttpResponse found = _session.send(StoreSession::propfind(target, 0), isAbsence);
    if (found.status != 207 || !reader.feed(found.body)) return std::nullopt;
    const auto entries = reader.finish();
    if (!entries || entries->size() != 1) return std::nullopt;
    if (entries->front().lastModified) return entries->front().lastModified;
    const auto told = dateIn(found, "date");
    return told ? told : Clock::system().now();
}

// ---- writing

void StoreFiles::keepWritten(const Url& name, const std::string& text) {
    _copies.forget(name.absoluteString());
    try {
        const Value written = PropertyList::fromXML(text);
        if (const Dictionary* content = written.dictionaryIf()) _copies.keep(name.absoluteString(), *content);
    } catch (const CXException&) { // no dictionary: nothing that could be read back
    }
}

HttpResponse StoreFiles::put(const Url& name, const Url& target, const std::shared_ptr<const std::string>& body,
                             std::vector<std::pair<std::string, std::string>> headers) {
    HttpRequest request = StoreSession::request("PUT", target);
    headers.emplace_back("Content-Type", contentType(*body));
    request.headers = std::move(headers);
    request.body = body;
    request.tellsKind = mayBeBoth(name);
    HttpResponse answer = _session.send(std::move(request), isAny);
    _early.forget(target);
    _ahead.forget(target);
    if (answer.ok()) noteWritten(name, answer, *body);
    return answer;
}

void StoreFiles::noteWritten(const Url& name, const HttpResponse& answer, const std::string& text) {
    const std::string* tag = answer.header("etag");
    const std::string* date = answer.header("date");
    _versions.wrote(name.absoluteString(), tag ? EntityTag(*tag) : EntityTag(),
                    date ? Date::fromHTTP(*date) : std::nullopt, text);
    if (mayBeBoth(name)) keepWritten(name, text);
}

// After a conditional write that was refused. One whose answer was lost on the way is sent again, and then meets its
// own version; and some servers get conditions wrong, or do not know them, whatever lies there.
StoreFiles::Standing StoreFiles::standing(const Url& name, const Url& target, const std::string& text,
                                          const FileCondition& condition) {
    const HttpResponse there = _session.send(StoreSession::request("GET", target), isAny);
    if (there.status == 404) return condition.isAbsent ? Standing::asKnown : Standing::other;
    if (there.status != kOk) return Standing::other;
    if (there.body == text) {
        noteWritten(name, there, text);
        return Standing::written;
    }
    const bool isKnown = !condition.isAbsent && isOneVersion(condition.etag, versionOf(there).etag);
    return isKnown ? Standing::asKnown : Standing::other;
}

int StoreFiles::write(const Url& name, std::string text, bool securely, const std::function<bool()>& repair) {
    ReadMark mark = takeMark(_reader, name);
    const auto url = _session.endpoint(name, securely);
    if (!url) return 0;
    if (mark.set && mark.state == ReadMark::State::unknown) return 0;
    const bool both = mayBeBoth(name);
    const Url state = both ? stateURL(*url) : Url();
    const Url first = both && knownCollection(*url) ? state : *url;
    const auto body = std::make_shared<const std::string>(std::move(text));
    HttpResponse answer;
    const auto attempt = [&](const Url& target) {
        const LockToken token = _tokens.tokenFor(target.absoluteString());
        answer = put(name, target, body, conditions(mark, token, target));
        if (!mark.set || !mayMeanTheCondition(answer.status)) return answer.status;
        switch (standing(name, target, *body, {mark.state == ReadMark::State::absent, mark.etag})) {
        case Standing::written: answer.status = kNoContent; break;
        case Standing::asKnown: answer = put(name, target, body, conditions({}, token, target)); break; // by the lock
        case Standing::other:
            if (isLeftOut("412")) answer = put(name, target, body, conditions({}, token, target));
            break;
        }
        return answer.status;
    };
    const auto last = [&](int status) {
        if (!succeeded(status)) _session.noteFailure("PUT", *url, answer);
        return status;
    };
    const int code = attempt(first);
    if (succeeded(code) || code == 0) return last(code);
    if (both && first == state && (code == 409 || code == 404 || code == 400)) { // the collection is gone
        forget(*url);
        return last(attempt(*url));
    }
    const bool mayBeInTheWay = code == 409 || code == 405 || code == 412 || (code >= 300 && code < 400);
    if (both && first == *url && mayBeInTheWay && kindOf(*url) == Kind::collection) {
        remember(*url);
        return last(attempt(state));
    }
    if ((code == 409 || code == 404) && repair && repair()) return last(attempt(first));
    return last(code);
}

int StoreFiles::remove(const Url& name) {
    const auto url = _session.endpoint(name);
    if (!url) return 0;
    const Url collection = namedAsCollection(*url);
    const bool isCollection = knownCollection(*url) || isAlwaysCollection(name);
    forget(*url);
    _versions.forget(name.absoluteString());
    _copies.forget(name.absoluteString());
    _early.forget(*url);
    _ahead.forget(*url);
    HttpResponse answer;
    const auto attempt = [&](const Url& target) {
        HttpRequest request = StoreSession::request("DELETE", target);
        const LockToken token = _tokens.tokenFor(target.absoluteString());
        if (!token.empty()) request.headers.emplace_back("If", taggedCondition(target, "<" + token.str() + ">"));
        answer = _session.send(std::move(request), isAny);
        return answer.status;
    };
    const int code = attempt(isCollection ? collection : *url);
    if (mayBeBoth(name)) {
        if (isCollection && mayMeanAnother(code) && kindOf(*url) == Kind::file)
            attempt(*url);
        else if (!isCollection && mayMeanAnother(code) && code != 404 && kindOf(*url) == Kind::collection)
            attempt(collection);
    }
    if (!succeeded(answer.status) && answer.status != 404) _session.noteFailure("DELETE", *url, answer);
    return answer.status;
}

// ---- collections

StoreFiles::Kind StoreFiles::kindOf(const Url& url, EntityTag* tag) {
    const HttpResponse answer = _session.send(StoreSession::propfind(url, 0), isAbsence);
    if (answer.status == 404) return Kind::absent;
    MultistatusReader reader;
    if (answer.status != 207 || !reader.feed(answer.body)) return Kind::unknown;
    const auto entries = reader.finish();
    if (!entries || entries->size() != 1) return Kind::unknown;
    if (tag) *tag = entries->front().etag;
    return entries->front().isCollection ? Kind::collection : Kind::file;
}

bool StoreFiles::makeCollection(const Url& name) {
    const auto url = _session.endpoint(name);
    if (!url) return false;
    const HttpResponse answer = _session.send(StoreSession::request("MKCOL", namedAsCollection(*url)), isInTheWay);
    if (answer.status == 405 && knownCollection(*url)) return true;
    if (answer.ok()) {
        remember(*url);
        return true;
    }
    if (!isInTheWay(answer.status)) return false;
    EntityTag tag;
    const Kind kind = kindOf(*url, &tag);
    if (kind == Kind::file && !moveIntoCollection(*url, tag)) return false;
    if (kind != Kind::collection && kind != Kind::file) {
        _session.noteFailure("MKCOL", *url, answer);
        return false;
    }
    remember(*url);
    return true;
}

// The new collection is made beside the file, gets a copy of it as its state, and then takes its place in one request:
// at no moment is the state missing. It does so only if the file is still the one that was copied.
bool StoreFiles::moveIntoCollection(const Url& url, const EntityTag& tag) {
    const Url making = url.cxURLByDeletingLastComponent().cxURLByAppendingComponent(url.cxLastComponent() +
                                                                                    std::string(kMakingSuffix));
    const Url collection = namedAsCollection(making);
    const HttpResponse made = _session.send(StoreSession::request("MKCOL", collection), isInTheWay);
    if (!made.ok() && made.status != 405) return false;
    HttpRequest copy = StoreSession::request("COPY", url);
    copy.headers = {{"Destination", stateURL(making).absoluteString()}, {"Overwrite", "T"}, {"Depth", "0"}};
    if (!_session.send(std::move(copy)).ok()) return false;
    HttpRequest move = StoreSession::request("MOVE", collection);
    move.headers = {{"Destination", url.absoluteString()}, {"Overwrite", "T"}};
    const HttpRequest unconditional = move;
    if (!tag.empty()) move.headers.emplace_back("If", taggedCondition(url, "[" + tag.str() + "]"));
    HttpResponse moved = _session.send(move, isAny);
    if (moved.ok()) return true;
    EntityTag now;
    const bool wantsSlash = moved.status == 409; // nginx: to the name of a collection, which ends with one
    const bool isLookedAt = wantsSlash || isGoneOrChanged(moved.status) || mayMeanTheCondition(moved.status);
    const Kind kind = isLookedAt ? kindOf(url, &now) : Kind::unknown;
    // One that was sent again because its answer was lost finds the collection in its place.
    if (kind == Kind::collection) return true;
    if (kind == Kind::file && wantsSlash && (tag.empty() || isOneVersion(tag, now))) {
        move.headers.front().second = namedAsCollection(url).absoluteString();
        moved = _session.send(std::move(move), isAny);
        if (moved.ok()) return true;
    }
    if (kind == Kind::file && mayMeanTheCondition(moved.status) && isOneVersion(tag, now)) {
        moved = _session.send(unconditional, isAny); // the server gets the condition wrong
        if (moved.ok()) return true;
    }
    _session.noteFailure("MOVE", url, moved);
    return false;
}

} // namespace rolvane
