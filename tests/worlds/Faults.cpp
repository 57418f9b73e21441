#include "Faults.h"

#include "../engine/Writes.h"

#include <array>

namespace rolvane::worlds {

namespace {

bool changes(const std::string& method) {
    return method != "GET" && method != "HEAD" && method != "PROPFIND" && method != "OPTIONS" && method != "REPORT";
}

HttpResponse broken(TransportError error, std::string detail) {
    HttpResponse response;
    response.error = error;
    response.detail = std::move(detail);
    return response;
}

HttpResponse answering(int status, std::string type, std::string body) {
    HttpResponse response;
    response.status = status;
    response.headers = {{"content-type", std::move(type)}, {"content-length", std::to_string(body.size())}};
    response.body = std::move(body);
    return response;
}

HttpResponse page() {
    return answering(200, "text/html", "<!DOCTYPE html><html><body>Accept our terms to go on.</body></html>");
}

// The name without the user, which is another one each time that a world is made again.
std::string nameOf(const HttpRequest& request) {
    const std::string path = request.url.encodedPath();
    const size_t tree = path.find("/Contacts");
    const size_t user = tree == std::string::npos ? 0 : path.rfind('/', tree - 1) + 1;
    return request.method + " " + (tree == std::string::npos ? path : path.substr(user, 1) + path.substr(tree));
}

} // namespace

// An answer that the store itself never gave.
std::optional<HttpResponse> FaultyTransport::answerOf(const HttpRequest& request, Chance& chance,
                                                      std::string& kind) const {
    const bool writes = changes(request.method);
    const bool own = request.url.encodedPath().starts_with(_weather.ownTree);
    const std::string path = request.url.encodedPath();
    switch (chance.below(10)) {
    case 0: kind = "500"; return answering(500, "text/plain", "no");
    case 1: kind = "503"; return answering(503, "text/plain", "not now");
    case 2: kind = "reset"; return broken(TransportError::unreachable, "reset");
    case 3: kind = "time-out"; return broken(TransportError::timedOut, "no answer in time");
    case 4: kind = "portal"; return page();
    case 5:
        if (request.method != "PUT" && request.method != "DELETE") return std::nullopt;
        kind = "412";
        return answering(412, "text/plain", "another version");
    case 6:
        if (!writes) return std::nullopt;
        kind = "423";
        return answering(423, "text/plain", "locked");
    case 7:
        if (writes && !own && !_weather.refusesWriter) return std::nullopt;
        kind = "403";
        if (writes && !own) kind = "403 to a writer";
        return answering(403, "text/plain", "you may not");
    case 8:
        if (request.method != "GET" || !path.ends_with("/Contacts/info")) return std::nullopt;
        kind = "404";
        return answering(404, "text/plain", "nothing here");
    default: return std::nullopt;
    }
}

FaultyTransport::Decision FaultyTransport::decide(const HttpRequest& request) {
    Decision decision;
    decision.name = nameOf(request);
    const std::lock_guard guard(_mutex);
    const int often = _asked[decision.name]++, number = _requests++;
    Chance chance(hashOf(decision.name, _weather.seed + static_cast<uint64_t>(often) * 7919));
    if (chance.happens(_weather.kill)) {
        decision.fate = chance.happens(0.5) ? Fate::killBefore : Fate::killAfter;
        return decision;
    }
    const bool spared = _weather.without.contains("locks") && (request.method == "LOCK" || request.method == "UNLOCK");
    if (_weather.storeAwayFrom >= 0 && !spared && number >= _weather.storeAwayFrom) {
        decision.kind = _weather.portal ? "away, portal" : "away";
        decision.answer = _weather.portal ? page() : broken(TransportError::unreachable, "away");
        decision.fate = Fate::answered;
        return decision;
    }
    if (!chance.happens(_weather.faults) || spared) return decision;
    decision.answer = answerOf(request, chance, decision.kind);
    if (_weather.without.contains(decision.kind)) {
        decision.answer.reset();
        decision.kind.clear();
    } else if (decision.answer) {
        decision.fate = Fate::answered;
    } else {
        const bool cut = chance.happens(0.5);
        decision.fate = cut ? Fate::cutAnswer : Fate::lostAnswer;
        decision.kind = cut ? "cut answer" : "lost answer";
        if (_weather.without.contains(decision.kind)) decision = Decision{Fate::pass, decision.name, {}, {}};
    }
    return decision;
}

void FaultyTransport::told(const Decision& decision) {
    if (decision.kind.empty()) return;
    _report.line(lines::kFault, decision.kind + " | " + decision.name);
    if (decision.kind == "403 to a writer") _report.line(lines::kRefused);
}

HttpResponse FaultyTransport::after(const Decision& decision, HttpResponse answer) {
    if (decision.fate == Fate::killAfter) _report.die("after " + decision.name);
    if (decision.fate == Fate::lostAnswer) return broken(TransportError::unreachable, "the answer was lost");
    if (decision.fate == Fate::cutAnswer) return broken(TransportError::truncated, "the answer was cut");
    if (answer.complete() && answer.status < 400) {
        const std::string method = decision.name.substr(0, decision.name.find(' '));
        if (changes(method) && method != "LOCK" && method != "UNLOCK" && !decision.name.ends_with("/dateFile"))
            _report.line(lines::kWrote, decision.name);
    }
    return answer;
}

HttpResponse FaultyTransport::perform(HttpRequest request) {
    const Decision decision = decide(request);
    if (meanwhile) meanwhile(hashOf(decision.name, _weather.seed ^ 0x5bd1e995));
    told(decision);
    if (decision.fate == Fate::killBefore) _report.die("before " + decision.name);
    if (decision.fate == Fate::answered) return *decision.answer;
    if (decision.fate == Fate::cutAnswer || decision.fate == Fate::lostAnswer) request.sink = nullptr;
    return after(decision, _to->perform(std::move(request)));
}

void FaultyTransport::start(HttpRequest request, Completion done) {
    const Decision decision = decide(request);
    told(decision);
    if (decision.fate == Fate::killBefore) _report.die("before " + decision.name);
    if (decision.fate == Fate::answered) return done(*decision.answer);
    if (decision.fate == Fate::cutAnswer || decision.fate == Fate::lostAnswer) request.sink = nullptr;
    _to->start(std::move(request), [this, decision, done = std::move(done)](HttpResponse answer) {
        done(after(decision, std::move(answer)));
    });
}

// The disk ----------------------------------------------------------------------------------------------------------

namespace {

std::atomic<int> writes = 0;
Weather onDisk;
Report* reporting = nullptr;
thread_local int unharmed = 0;

bool mayWrite() {
    if (unharmed > 0) return true;
    const int number = writes++;
    if (onDisk.killBeforeWrite >= 0 && number >= onDisk.killBeforeWrite)
        reporting->die("before write " + std::to_string(number));
    const bool full =
        onDisk.diskFullFrom >= 0 && number >= onDisk.diskFullFrom && number < onDisk.diskFullFrom + onDisk.diskFullFor;
    if (full) reporting->line(lines::kDiskFull, std::to_string(number));
    return !full;
}

} // namespace

void endureOnDisk(const Weather& weather, Report& report) {
    onDisk = weather;
    reporting = &report;
    test::interceptWrites(mayWrite);
}

Unharmed::Unharmed() {
    ++unharmed;
}
Unharmed::~Unharmed() {
    --unharmed;
}

} // namespace rolvane::worlds
