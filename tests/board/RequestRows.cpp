#include "RequestRows.h"

#include "../apps/FaultyStore.h"

#include <array>
#include <optional>

namespace rolvane::board {

namespace {

using test::FakeAnswer;
using test::FakeRequest;

constexpr std::array kKinds{
    "500", "503",   "503 for a second", "429",      "401",  "403",         "404", "409", "412", "423",
    "507", "reset", "lost answer",      "cut body", "half", "portal page", "hang"};
// The last kind takes the twenty seconds until a client gives up, and comes at each so many-th request.
constexpr size_t kHangs = 12;
constexpr size_t kMostRequests = 2000;
constexpr int64_t kAnHour = 3600; // a refused change rests for half an hour at most

std::string whole(int status, const std::string& type, const std::string& body, size_t announced) {
    return "HTTP/1.1 " + std::to_string(status) + " Said\r\nContent-Type: " + type +
           "\r\nContent-Length: " + std::to_string(announced) + "\r\n\r\n" + body;
}

FakeAnswer answerOf(const std::string& kind) {
    if (kind == "reset") return FakeAnswer::raw({});
    if (kind == "hang") {
        FakeAnswer silent;
        silent.silent = true;
        return silent;
    }
    if (kind == "portal page")
        return FakeAnswer::status(200, "<!DOCTYPE html><html><body>Accept our terms.</body></html>",
                                  "Content-Type: text/html\r\n");
    const std::string xml = "<?xml version=\"1.0\"?><D:multistatus xmlns:D=\"DAV:\"><D:response><D:hr";
    if (kind == "cut body") return FakeAnswer::raw(whole(207, "application/xml", xml, xml.size() + 100));
    if (kind == "half") return FakeAnswer::raw(whole(207, "application/xml", xml, xml.size()), false);
    if (kind == "503 for a second") return FakeAnswer::status(503, "not now", "Retry-After: 1\r\n");
    if (kind == "401") return FakeAnswer::status(401, "who?", "WWW-Authenticate: Basic realm=\"Rolvane\"\r\n");
    return FakeAnswer::status(std::stoi(kind), "no");
}

bool changes(const std::string& request) {
    return !request.starts_with("GET") && !request.starts_with("PROPFIND") && !request.starts_with("OPTIONS") &&
           !request.starts_with("HEAD") && !request.starts_with("REPORT");
}

// One request of a pass meets the fault.
class Spoiled {
public:
    // `often`: how many requests, from that number on.
    Spoiled(test::FaultyStore& store, size_t number, std::string kind, Spoils spoils, size_t often = 1)
        : _store(store) {
        _store.set([this, number, spoils, often,
                    kind = std::move(kind)](const FakeRequest& request) -> std::optional<FakeAnswer> {
            const bool loses = kind == "lost answer";
            if (spoils == Spoils::listings && request.method == "OPTIONS") return withoutExtensions(request);
            if (spoils == Spoils::writes && !changes(request.method)) return std::nullopt;
            if (spoils == Spoils::listings && request.method != "PROPFIND") return std::nullopt;
            {
                const std::lock_guard guard(_lock);
                const size_t count = _count++;
                if (count < number || count - number >= often) return std::nullopt;
                _met = request.method + " " + request.target;
            }
            if (!loses) return answerOf(kind);
            (void)_store.handOn(request);
            return FakeAnswer::raw({});
        });
    }
    ~Spoiled() { _store.set(nullptr); }
    Spoiled(const Spoiled&) = delete;
    Spoiled& operator=(const Spoiled&) = delete;
    std::string met() const {
        const std::lock_guard guard(_lock);
        return _met;
    }

private:
    // The server is any WebDAV server, and tells nothing of its own.
    FakeAnswer withoutExtensions(const FakeRequest& request) {
        FakeAnswer answer = _store.handOn(request);
        std::string& bytes = answer.pieces.front().bytes;
        for (const std::string extension :
             {"<http://rolvane.net/ns/sync-collection>", "<http://rolvane.net/ns/members-tag>"})
            if (const size_t at = bytes.find(extension); at != std::string::npos)
                bytes.replace(at, extension.size(), "<http://example.org/nothing>");
        return answer;
    }
    test::FaultyStore& _store;
    mutable std::mutex _lock; // guards the following
    size_t _count = 0;
    std::string _met;
};

// A pass with each write from this one on spoiled; none when it makes fewer.
std::optional<Ending> passWithoutWrites(Stage& stage, char role, size_t write, const std::string& kind) {
    const Spoiled spoiled(stage.entrance(), write, kind, Spoils::writes, kMostRequests);
    const Ending ending = stage.pass(role);
    const std::string met = spoiled.met();
    if (met.empty()) return std::nullopt;
    stage.tell("   FAULT " + kind + " from " + met + " on");
    return ending;
}

} // namespace

bool spoilRequest(Work& work, const Scenario& scenario, size_t request, const std::string& kind, Spoils spoils) {
    Stage& stage = work.stage;
    stage.forgetStory();
    stage.bringBack(scenario.name);
    Ending ending;
    std::string met;
    {
        const Spoiled spoiled(stage.entrance(), request, kind, spoils);
        ending = stage.pass(scenario.role);
        met = spoiled.met();
    }
    if (met.empty()) return false;
    stage.tell("   FAULT " + kind + " at " + met);
    if (kind == "403" && scenario.role == 'w' && changes(met)) stage.model().refused('w');
    goOn(work, scenario, request);
    Settling settling = settlingOf(scenario);
    settling.later = kAnHour;
    judge(work,
          scenario.name + ", " + kind + " at request " + std::to_string(request) + " " + met.substr(0, met.find(' ')),
          settling, ending);
    return true;
}

bool spoilWrites(Work& work, const Scenario& scenario, size_t write, const std::string& kind) {
    Stage& stage = work.stage;
    stage.forgetStory();
    stage.bringBack(scenario.name);
    const std::optional<Ending> ending = passWithoutWrites(stage, scenario.role, write, kind);
    if (!ending) return false;
    if (kind == "403" && scenario.role == 'w') stage.model().refused('w');
    goOn(work, scenario, write);
    Settling settling = settlingOf(scenario);
    settling.later = kAnHour;
    judge(work, scenario.name + ", " + kind + " from write " + std::to_string(write) + " on", settling, *ending);
    return true;
}

bool spoilNewOnes(Work& work, const Scenario& scenario, size_t write, const std::string& kind) {
    constexpr size_t kNewOnes = 4;
    Stage& stage = work.stage;
    const std::string stamp = "new" + std::to_string(write);
    stage.forgetStory();
    stage.bringBack(scenario.name);
    const auto makes = [](worlds::Editor& editor) { editor.makePeople(kNewOnes); };
    stage.edit(scenario.role, makes, stamp);
    const std::optional<Ending> ending = passWithoutWrites(stage, scenario.role, write, kind);
    if (!ending) return false;
    const auto takesBack = [&](worlds::Editor& editor) { editor.takeBack(stamp); };
    stage.edit(scenario.role, takesBack, "back");
    judge(work, scenario.name + " with new contacts, " + kind + " from write " + std::to_string(write) + " on",
          settlingOf(scenario), *ending);
    return true;
}

void spoilRequests(Work& work) {
    for (const Scenario& scenario : scenarios())
        for (size_t kind = 0; kind < kKinds.size(); ++kind)
            for (size_t request = 0; request < kMostRequests; ++request) {
                if (!work.isMine(request + kind)) continue;
                if (kind + 1 == kKinds.size() && request / work.every % kHangs != 0) continue;
                if (work.timeIsOver()) return;
                if (!spoilRequest(work, scenario, request, kKinds[kind])) break;
            }
}

} // namespace rolvane::board
