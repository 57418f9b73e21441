#include "Judge.h"

#include <filesystem>
#include <set>

namespace rolvane::board {

namespace {

namespace fs = std::filesystem;
using worlds::View;
constexpr int kPasses = 2, kMostPasses = 4;

std::string nameOf(char role) {
    return role == 'o' ? "owner" : role == 'w' ? "writer" : "reader";
}

std::string orderFrom(char first) {
    std::string order(1, first);
    for (const char* role = Stage::kRoles; *role; ++role)
        if (*role != first) order += *role == 'r' ? "" : std::string(1, *role);
    if (first != 'r') order += 'r';
    return order;
}

void addAll(std::vector<std::string>& to, const std::string& where, const std::vector<std::string>& found) {
    for (const std::string& each : found) to.push_back(where + ": " + each);
}

template <class Parts>
void compare(const Parts& ours, const Parts& theirs, const std::string& whose, std::vector<std::string>& wrong) {
    std::set<std::string> names;
    for (const Parts* each : {&ours, &theirs})
        for (const auto& [name, value] : *each) names.insert(name);
    for (const std::string& name : names) {
        const auto a = ours.find(name), b = theirs.find(name);
        if (a == ours.end() || b == theirs.end())
            wrong.push_back(name + " is missing at " + (a == ours.end() ? "owner" : whose));
        else if (a->second != b->second)
            wrong.push_back(name + " differs between owner and " + whose);
    }
}

std::vector<std::string> leftIn(const std::string& home) {
    std::vector<std::string> left;
    std::error_code none;
    for (const auto& entry : fs::recursive_directory_iterator(home, none)) {
        const std::string name = entry.path().filename().string();
        if (name.find(".writing-") != std::string::npos) left.push_back("a temporary file is left: " + name);
        if (entry.path().parent_path().filename() == "locks") left.push_back("a note of a lock is left: " + name);
    }
    return left;
}

std::vector<std::string> differences(Stage& stage, bool knowsDeeds) {
    std::vector<std::string> wrong;
    const View owner = stage.view('o'), store = stage.storeView();
    const auto judge = [&](const std::string& where, const View& view) {
        addAll(wrong, where, knowsDeeds ? stage.model().differences(view) : view.faults);
    };
    judge("owner", owner);
    judge("store", store);
    compare(owner.people, store.people, "store", wrong);
    compare(owner.groups, store.groups, "store", wrong);
    for (const char role : {'w', 'r'}) {
        const View copy = stage.view(role);
        judge(nameOf(role), copy);
        compare(owner.whole, copy.whole, nameOf(role), wrong);
    }
    return wrong;
}

} // namespace

Verdict settleAndJudge(Stage& stage, const Settling& settling) {
    Verdict verdict;
    std::vector<std::string> unclean, differing;
    Fault calm;
    calm.clock = settling.later;
    bool subscribed = !settling.subscribes;
    const auto clean = [&](char role) {
        const Ending ending = stage.pass(role, calm);
        if (ending.late) unclean.push_back(nameOf(role) + ": a clean pass does not end");
        if (!ending.late && (ending.signal != 0 || ending.status != 0))
            unclean.push_back(nameOf(role) + ": a clean pass ends with status " + std::to_string(ending.status) +
                              ", signal " + std::to_string(ending.signal));
        if (subscribed) return;
        subscribed = true;
        for (const char each : {'w', 'r'})
            if (stage.command(each, {"subscribe", stage.userOf('o'), "--no-daemon"}).status != 0)
                unclean.push_back(nameOf(each) + ": cannot subscribe");
    };
    const auto round = [&] {
        for (const char role : orderFrom(settling.first)) clean(role);
    };
    for (int passes = 1; passes <= kMostPasses; ++passes) {
        round();
        if (passes < kPasses) continue;
        differing = differences(stage, settling.knowsDeeds);
        if (differing.empty()) break;
        verdict.late = true;
        for (const std::string& each : differing) stage.tell("!! after " + std::to_string(passes) + ": " + each);
    }
    (void)stage.writesToTheStore();
    constexpr int64_t kTwoMinutes = 120; // a temporary file that nobody holds is left alone for a minute
    calm.clock += kTwoMinutes;
    round();
    verdict.wrong = differing;
    verdict.wrong.insert(verdict.wrong.end(), unclean.begin(), unclean.end());
    addAll(verdict.wrong, "not at rest", stage.writesToTheStore());
    addAll(verdict.wrong, "a lock is left on the clock file", stage.locksOnTheStore());
    for (const char* role = Stage::kRoles; *role; ++role)
        addAll(verdict.wrong, nameOf(*role), leftIn(stage.home(*role)));
    for (const std::string& each : verdict.wrong) stage.tell("!! " + each);
    return verdict;
}

} // namespace rolvane::board
