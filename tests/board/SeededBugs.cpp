#include "SeededBugs.h"

#include "ClockRows.h"
#include "KillRows.h"
#include "LossRows.h"
#include "MeetingRows.h"
#include "PowerRows.h"
#include "RequestRows.h"

#include <algorithm>

namespace rolvane::board {

namespace {

const Scenario& scenario(const std::string& name) {
    for (const Scenario& each : scenarios())
        if (each.name == name) return each;
    return scenarios().front();
}

// Makes the case of that number of one row; false when there are no more.
using Hunt = std::function<bool(Work& work, size_t number)>;

constexpr size_t kStride = 5;

Hunt kills(const std::string& of) {
    return [of](Work& work, size_t number) { return killOnce(work, scenario(of), number * kStride); };
}
Hunt killsWithNewOnes(const std::string& of, Behind behind) {
    return [=](Work& work, size_t number) { return killWithNewOnes(work, scenario(of), number * kStride, behind); };
}
Hunt answers(const std::string& kind, const std::string& of, Spoils spoils = Spoils::all) {
    return [=](Work& work, size_t number) { return spoilRequest(work, scenario(of), number, kind, spoils); };
}
Hunt answersToWrites(const std::string& kind, const std::string& of) {
    return [=](Work& work, size_t number) { return spoilWrites(work, scenario(of), number, kind); };
}
Hunt answersToNewOnes(const std::string& kind, const std::string& of) {
    return [=](Work& work, size_t number) { return spoilNewOnes(work, scenario(of), number, kind); };
}
Hunt meetings(const std::string& of, bool newOnes = false) {
    return [=](Work& work, size_t number) { return meetOnce(work, scenario(of), number, newOnes); };
}
bool powerLosses(Work& work, size_t number) {
    losePowerBehindACommand(work, number);
    return true;
}
struct SeededBug {
    const char* part; // what is left out, as the sources name it
    Hunt hunt;
};

const std::vector<SeededBug>& seededBugs() {
    static const std::vector<SeededBug> all{
        {"if-match", meetings("owner-later")},
        {"sync", powerLosses},
        {"if-none-match", meetings("owner-later", true)},
        {"412", meetings("owner-later")},
        {"5xx", answers("500", "writer-later", Spoils::writes)},
        {"proof", answers("portal page", "writer-later", Spoils::writes)},
        {"end of listing", answers("half", "owner-later", Spoils::listings)},
        {"lost tree", loseFilesOnce},
        {"queue", answersToWrites("503", "owner-later")},
        {"taking back", answersToWrites("403", "writer-later")},
        {"states", calmOnce},
        {"merging", meetings("owner-later")},
        {"unlocking", calmOnce},
        {"under way", killsWithNewOnes("owner-later", Behind::takesBack)},
        {"note before the workers", killsWithNewOnes("writer-later", Behind::takesBack)},
        {"content before the write", killsWithNewOnes("writer-later", Behind::changesNumbers)},
        {"claim", kills("writer-first")},
        {"unsettled writes", answersToNewOnes("lost answer", "owner-later")},
        {"leftovers", kills("owner-first")},
        {"date of the store", turnClockOnce},
    };
    return all;
}

class Search {
public:
    Search(Work& work, const SeededBug& bug) : _work(work), _bug(bug) {}

    // The name of a case that fails without the part, and goes well with it; none was found.
    std::optional<std::string> found() {
        constexpr size_t kMost = 60;
        for (size_t number = 0; number < kMost && !_work.timeIsOver(); ++number) {
            const auto failure = failureOf(number, _bug.part);
            if (!_exists) return std::nullopt;
            if (failure && !failureOf(number, "")) return failure;
        }
        return std::nullopt;
    }

private:
    std::optional<std::string> failureOf(size_t number, const std::string& part) {
        Count count;
        std::optional<std::string> failure;
        Work one{_work.stage, count, 0, 1, 1, true, [] { return false; }, nullptr};
        one.failed = [&](const std::string& name, const std::vector<std::string>& wrong) {
            failure = name + ": " + wrong.front();
        };
        _work.stage.leaveOut(part);
        _exists = _bug.hunt(one, number);
        _work.stage.leaveOut("");
        return failure;
    }

    Work& _work;
    const SeededBug& _bug;
    bool _exists = true;
};

} // namespace

void findSeededBugs(Work& work) {
    for (size_t number = 0; number < seededBugs().size(); ++number) {
        if (!work.isMine(number)) continue;
        if (work.timeIsOver()) return;
        const SeededBug& bug = seededBugs()[number];
        if (!work.parts.empty() && std::find(work.parts.begin(), work.parts.end(), bug.part) == work.parts.end())
            continue;
        const auto found = Search(work, bug).found();
        if (!found && work.timeIsOver()) return; // it may have been cut off
        ++work.count.cases;
        if (found) {
            work.told("\"" + std::string(bug.part) + "\" is missed by " + *found);
            continue;
        }
        ++work.count.failures;
        work.failed(std::string("without \"") + bug.part + "\"", {"no case notices that it is left out"});
    }
}

} // namespace rolvane::board
