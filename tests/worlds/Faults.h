#pragma once

#include "Chance.h"
#include "Report.h"
#include "store/http/HttpTransport.h"

#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>

namespace rolvane::worlds {

// What befalls one process of a world. Everything at a request is decided by the seed, the method, the name and how
// often that was asked already, so it does not depend on the order in which threads ask.
struct Weather {
    uint64_t seed = 0;
    double faults = 0;             // of the requests that meet one
    double kill = 0;               // that the process is killed before or after a request
    int killBeforeWrite = -1;      // to a file of the daemon's; -1: never
    int diskFullFrom = -1;         // write to a file of the daemon's; -1: never
    int diskFullFor = 0;           // writes
    int storeAwayFrom = -1;        // request; -1: never
    double later = 0;              // seconds that this process's daemon lives behind the others
    bool portal = false;           // while it is away somebody else answers
    bool refusesWriter = false;    // a fault may be a refusal of a write to somebody else's tree
    std::string ownTree;           // the path of the person's own
    std::set<std::string> without; // kinds of faults that do not happen; "locks": none at LOCK and UNLOCK
};

// Sends requests on, or answers in the store's place, or loses the answer, or ends the process.
class FaultyTransport : public HttpTransport {
public:
    FaultyTransport(std::shared_ptr<HttpTransport> to, Weather weather, Report& report)
        : _to(std::move(to)), _weather(std::move(weather)), _report(report) {}

    HttpResponse perform(HttpRequest request) override;
    void start(HttpRequest request, Completion done) override;
    void abortAll() override { _to->abortAll(); }
    void resume() override { _to->resume(); }
    // Asked at the beginning of each request that somebody waits for.
    std::function<void(uint64_t number)> meanwhile;

private:
    enum class Fate { pass, killBefore, killAfter, answered, lostAnswer, cutAnswer };
    struct Decision {
        Fate fate = Fate::pass;
        std::string name, kind; // of the request, of the fault
        std::optional<HttpResponse> answer;
    };
    Decision decide(const HttpRequest& request);
    std::optional<HttpResponse> answerOf(const HttpRequest& request, Chance& chance, std::string& kind) const;
    void told(const Decision& decision);
    HttpResponse after(const Decision& decision, HttpResponse answer);

    const std::shared_ptr<HttpTransport> _to;
    const Weather _weather;
    Report& _report;
    std::mutex _mutex; // guards the following
    std::map<std::string, int> _asked;
    int _requests = 0;
};

// Lets writes to SQLite files of this process fail, or ends it before one, as the weather says. Writes of a thread that
// holds an `Unharmed` always go well. Once a process.
void endureOnDisk(const Weather& weather, Report& report);
class Unharmed {
public:
    Unharmed();
    ~Unharmed();
    Unharmed(const Unharmed&) = delete;
    Unharmed& operator=(const Unharmed&) = delete;
};

} // namespace rolvane::worlds
