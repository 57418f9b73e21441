#include "ResidentRows.h"

#include <algorithm>
#include <atomic>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <sstream>

namespace rolvane::board {

namespace {

namespace fs = std::filesystem;
using test::FakeAnswer;
using test::FakeRequest;

constexpr size_t kPasses = 1000, kEditsInAPass = 2, kFewest = 8;
constexpr size_t kEnoughForMemory = 200; // passes, before whose end a process is still finding its size

struct Size {
    size_t memory = 0, descriptors = 0, threads = 0; // memory in KiB
    size_t files = 0, bytes = 0;                     // in the home
};

size_t numberBehind(const std::string& status, const std::string& name) {
    const size_t at = status.find(name);
    return at == std::string::npos ? 0 : std::strtoull(status.c_str() + at + name.size(), nullptr, 10);
}

Size sizeOf(pid_t process, const std::string& home) {
    Size size;
    const std::string directory = "/proc/" + std::to_string(process);
    std::ostringstream status;
    status << std::ifstream(directory + "/status").rdbuf();
    size.memory = numberBehind(status.str(), "VmRSS:");
    size.threads = numberBehind(status.str(), "Threads:");
    std::error_code none;
    for ([[maybe_unused]] const auto& each : fs::directory_iterator(directory + "/fd", none)) ++size.descriptors;
    for (const auto& each : fs::recursive_directory_iterator(home, none)) {
        std::error_code gone;
        if (!each.is_regular_file(gone)) continue;
        ++size.files;
        if (const auto bytes = each.file_size(gone); !gone) size.bytes += bytes;
    }
    return size;
}

std::string textOf(const Size& size) {
    return std::to_string(size.memory) + " KiB, " + std::to_string(size.descriptors) + " descriptors, " +
           std::to_string(size.threads) + " threads, " + std::to_string(size.files) + " files of " +
           std::to_string(size.bytes / 1024) + " KiB";
}

// Every tenth request fails, in one of four ways, as the seed has it.
class BadWeather {
public:
    BadWeather(test::FaultyStore& store, uint64_t seed) : _store(store) {
        _store.set([this, seed](const FakeRequest& request) -> std::optional<FakeAnswer> {
            const size_t number = requests++;
            const uint64_t chance = worlds::hashOf("weather", seed * 1000000 + number);
            if (chance % 10 != 0) return std::nullopt;
            ++faults;
            switch (chance / 10 % 4) {
            case 0: return FakeAnswer::status(500, "no");
            case 1: return FakeAnswer::status(503, "not now");
            case 2: return FakeAnswer::raw({});
            default: (void)_store.handOn(request); return FakeAnswer::raw({}); // done, and not answered
            }
        });
    }
    ~BadWeather() { _store.set(nullptr); }
    BadWeather(const BadWeather&) = delete;
    BadWeather& operator=(const BadWeather&) = delete;
    std::atomic<size_t> requests = 0, faults = 0;

private:
    test::FaultyStore& _store;
};

void compare(const Size& before, const Size& now, bool withMemory, const std::string& whose,
             std::vector<std::string>& wrong) {
    constexpr size_t kMoreMemory = 4096, kMoreFiles = 6;
    constexpr size_t kLogs = 3 * 4194304; // so much the logs of the databases may take before they begin anew
    const std::string both = whose + "'s daemon had " + textOf(before) + ", and has " + textOf(now);
    if (withMemory && now.memory > before.memory + before.memory / 10 + kMoreMemory) wrong.push_back(both);
    if (now.files > before.files + kMoreFiles) wrong.push_back(both);
    if (withMemory && now.bytes > 2 * before.bytes + kLogs) wrong.push_back(both);
}

} // namespace

void stayAndWork(Work& work) {
    if (work.job != 0) return;
    Stage& stage = work.stage;
    const size_t passes = std::max(kPasses / work.every, kFewest);
    stage.forgetStory();
    stage.bringBack("in-step");
    worlds::Chance chance(worlds::hashOf("residents", stage.seed()));
    worlds::Habits habits;
    habits.most = 10;
    habits.leaveOne = true;
    habits.turn = 0;

    std::map<char, std::unique_ptr<test::ChildProcess>> daemons;
    for (const char* role = Stage::kRoles; *role; ++role) daemons[*role] = stage.startDaemon(*role);
    const auto sync = [&](char role) { return stage.command(role, {"sync", "--timeout", "50"}).status; };
    std::map<char, Size> early, late;
    size_t made = 0, faults = 0, requests = 0;
    {
        const BadWeather weather(stage.entrance(), stage.seed());
        for (; made < passes && !work.timeIsOver(); ++made) {
            const char role = Stage::kRoles[made % 5 == 4 ? 2 : chance.below(2)]; // 'r' edits nothing
            if (role != 'r')
                for (size_t i = 0; i < kEditsInAPass; ++i)
                    stage.edit(role, habits, "p" + std::to_string(made) + "." + std::to_string(i));
            (void)sync(role); // a pass in such weather may fail
            stage.forgetStory();
            ++work.count.cases;
            if (made == passes / 4)
                for (const auto& [whose, daemon] : daemons) early[whose] = sizeOf(daemon->pid(), stage.home(whose));
        }
        faults = weather.faults;
        requests = weather.requests;
    }
    std::vector<std::string> wrong;
    for (int round = 0; round < 3; ++round)
        for (const char role : {'o', 'w', 'r'})
            if (const int status = sync(role); round > 0 && status != 0)
                wrong.push_back(std::string(1, role) + ": a pass in good weather ends with " + std::to_string(status));
    for (const auto& [whose, daemon] : daemons) {
        late[whose] = sizeOf(daemon->pid(), stage.home(whose));
        if (early.contains(whose))
            compare(early[whose], late[whose], made >= kEnoughForMemory, std::string(1, whose), wrong);
        // Connections and threads come and go with a pass; at rest a daemon needs few.
        constexpr size_t kMostDescriptors = 64, kMostThreads = 24;
        if (late[whose].descriptors > kMostDescriptors || late[whose].threads > kMostThreads)
            wrong.push_back(std::string(1, whose) + "'s daemon at rest has " + textOf(late[whose]));
        if (!daemon->running()) wrong.push_back(std::string(1, whose) + "'s daemon has ended");
        daemon->signal(SIGTERM);
        if (!daemon->wait()) wrong.push_back(std::string(1, whose) + "'s daemon does not end");
        stage.tell(daemon->errors());
    }
    daemons.clear();
    Settling settling;
    settling.later = 8 * 86400; // names without contacts and contacts without names are left for a week
    const Verdict verdict = settleAndJudge(stage, settling);
    wrong.insert(wrong.end(), verdict.wrong.begin(), verdict.wrong.end());
    work.told(std::to_string(made) + " passes, " + std::to_string(stage.model().deeds) + " changes, " +
              std::to_string(faults) + " of " + std::to_string(requests) +
              " requests failed; the owner's daemon: " + textOf(early['o']) + "; in the end " + textOf(late['o']));
    if (wrong.empty()) return;
    ++work.count.failures;
    work.failed(std::to_string(made) + " passes of daemons that stay", wrong);
}

} // namespace rolvane::board
