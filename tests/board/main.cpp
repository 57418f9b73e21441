// The board of faults: every fault at every place that it can strike, with the real programs. See docs/reliability.md.

#include "Board.h"
#include "ClockRows.h"
#include "DamageRows.h"
#include "DiskRows.h"
#include "KillRows.h"
#include "LossRows.h"
#include "MeetingRows.h"
#include "PowerRows.h"
#include "RequestRows.h"
#include "ResidentRows.h"
#include "SeededBugs.h"
#include "Table.h"
#include "foundation/CXException.h"

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <memory>
#include <new>
#include <sstream>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

namespace rolvane::board {

const std::vector<Row>& rows() {
    static const std::vector<Row> all{
        {"kill", "SIGKILL at every durable operation of a pass, and behind every answer", killEverywhere},
        {"twice", "a second SIGKILL, in the pass that recovers", killTwice},
        {"disk", "a full, a failing, a read-only disk at every change of a file, once and from then on", breakDisk},
        {"power", "power lost: what was synced is there, later writes in part, later names up to a moment", losePower},
        {"clock", "the clock an hour, a day and ten years ahead and behind, for one pass", turnClock},
        {"request",
         "each request of a pass answered by 500, 503, 429, 401, 403, 404, 409, 412, 423, 507, a portal or half a "
         "document, cut, reset, not at all, or lost behind its deed",
         spoilRequests, true},
        {"calm", "none: each pass as it is", calm},
        {"meet",
         "a contact is written by somebody else, who asks for no lock, between a pass's reading and its writing", meet,
         true},
        {"loss", "the store loses a file, or all files of a kind, of a tree that everybody has in step", loseFiles},
        {"damage", "the database, its log, the account or another file of a home damaged at a place of chance", damage},
        {"stay", "daemons that stay make 1,000 passes with 10,000 changes, and a tenth of the requests fails",
         stayAndWork, true},
        {"bugs", "the programs go wrong on purpose: one part after the other is left out; a failure is one not noticed",
         findSeededBugs, true},
    };
    return all;
}

namespace {

constexpr const char* kUsage = R"(usage: board [--seeds LIST] [--rows NAME,...] [--parts NAME,...] [--jobs N]
             [--every N] [--seconds N] [--alone] [--keep DIRECTORY] [--table FILE]

Each row is a kind of fault. A case lets it strike an owner, a writer or a reader at one place, lets everybody make two
clean passes, and compares the three copies and the store with one another and with what was done. Exit status 1 when
anything is wrong.

  --seeds    numbers, as 1,2,3; each makes other contacts and edits (1)
  --rows     which rows; all unless given
  --parts    of the row bugs: which parts are left out; all unless given
  --jobs     how many processes work on it (1)
  --every    only each so many-th case (1)
  --seconds  ends after about so long; the rows that were cut off say so
  --alone    nobody edits between the fault and the clean passes; else who was harmed goes on, or somebody else, or nobody
  --keep     where the story of each case that went wrong is put
  --table    the Markdown file whose table, between two marks, is replaced by this run's
)";

struct Arguments {
    std::vector<uint64_t> seeds{1};
    std::vector<Row> rows;
    size_t jobs = 1, every = 1, seconds = 0;
    bool goesOn = true;
    std::string keep, table;
    std::vector<std::string> parts;
};

[[noreturn]] void misuse(const std::string& what) {
    std::cerr << "board: " << what << "\n" << kUsage;
    std::exit(2);
}

std::vector<std::string> listOf(const std::string& text) {
    std::istringstream list(text);
    std::vector<std::string> all;
    for (std::string each; std::getline(list, each, ',');) all.push_back(each);
    return all;
}

size_t numberOf(const std::string& text) {
    char* end = nullptr;
    const uint64_t number = std::strtoull(text.c_str(), &end, 10);
    if (text.empty() || *end != '\0') misuse("\"" + text + "\" is no number");
    return number;
}

Arguments argumentsOf(int argc, char** argv) {
    Arguments a;
    a.rows = rows();
    for (int i = 1; i < argc; ++i) {
        const std::string name = argv[i];
        if (name == "--help") {
            std::cout << kUsage;
            std::exit(0);
        }
        if (name == "--alone") {
            a.goesOn = false;
            continue;
        }
        if (i + 1 == argc) misuse(name + " needs a value");
        const std::string value = argv[++i];
        if (name == "--seeds") {
            a.seeds.clear();
            for (const std::string& each : listOf(value)) a.seeds.push_back(numberOf(each));
        } else if (name == "--rows") {
            const std::vector<std::string> names = listOf(value);
            std::erase_if(
                a.rows, [&](const Row& row) { return std::find(names.begin(), names.end(), row.name) == names.end(); });
            if (a.rows.size() != names.size()) misuse("there is no such row among " + value);
        } else if (name == "--parts") {
            a.parts = listOf(value);
        } else if (name == "--jobs") {
            a.jobs = std::max<size_t>(1, numberOf(value));
        } else if (name == "--every") {
            a.every = std::max<size_t>(1, numberOf(value));
        } else if (name == "--seconds") {
            a.seconds = numberOf(value);
        } else if (name == "--keep") {
            a.keep = value;
        } else if (name == "--table") {
            a.table = value;
        } else {
            misuse("there is no option " + name);
        }
    }
    return a;
}

void print(const std::string& text) {
    [[maybe_unused]] const ssize_t n = ::write(STDOUT_FILENO, text.data(), text.size());
}

void keepStory(const Arguments& arguments, const Stage& stage, const std::string& row, std::string name) {
    if (arguments.keep.empty()) return;
    std::replace(name.begin(), name.end(), ' ', '-');
    std::filesystem::create_directories(arguments.keep);
    std::ofstream(arguments.keep + "/" + row + "-seed-" + std::to_string(stage.seed()) + "-" + name) << stage.story();
}

// All rows and seeds, as far as they are this process's. Each row has an equal part of the time that is left.
void work(const Arguments& arguments, Count* counts, size_t job) {
    using Clock = std::chrono::steady_clock;
    const test::TempHome home;
    PrivateStoreOptions options;
    options.stateDirectory = home / "store";
    options.ownsProcess = true;
    options.accessLog = true;
    constexpr int kQuick = 4;
    options.passwordCost = kQuick;
    PrivateStore store(options);
    store.start();
    const auto end = Clock::now() + std::chrono::seconds(arguments.seconds);
    size_t left = arguments.seeds.size() * arguments.rows.size();
    for (const uint64_t seed : arguments.seeds) {
        std::unique_ptr<Stage> stage;
        bool entrance = false;
        for (size_t i = 0; i < arguments.rows.size(); ++i, --left) {
            const Row& row = arguments.rows[i];
            if (!stage || entrance != row.usesEntrance) {
                entrance = row.usesEntrance;
                stage = nullptr;
                stage = std::make_unique<Stage>(store, ROLVANE_BOARD_SHIM, seed, entrance);
                makeScenarios(*stage);
            }
            Count& count = counts[i];
            const auto share = Clock::now() + (end - Clock::now()) / static_cast<int64_t>(left);
            Work todo{*stage, count, job, arguments.jobs, arguments.every, arguments.goesOn, nullptr, nullptr};
            todo.parts = arguments.parts;
            todo.told = [](const std::string& line) { print(line + "\n"); };
            todo.timeIsOver = [&] {
                const bool over = arguments.seconds > 0 && count.cases > 0 && Clock::now() > share;
                if (over) count.cut = true;
                return over;
            };
            todo.failed = [&](const std::string& name, const std::vector<std::string>& wrong) {
                std::string text = row.name + ", seed " + std::to_string(seed) + ": " + name + "\n";
                constexpr size_t kMost = 8;
                for (size_t line = 0; line < std::min(wrong.size(), kMost); ++line) text += "    " + wrong[line] + "\n";
                if (wrong.size() > kMost) text += "    and " + std::to_string(wrong.size() - kMost) + " more\n";
                print(text);
                keepStory(arguments, *stage, row.name, name);
            };
            row.run(todo);
        }
    }
}

int run(const Arguments& arguments) {
    const size_t size = arguments.rows.size() * sizeof(Count);
    void* shared = ::mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
    if (shared == MAP_FAILED) misuse("there is no memory");
    auto* counts = static_cast<Count*>(shared);
    for (size_t i = 0; i < arguments.rows.size(); ++i) new (counts + i) Count;
    for (size_t job = 0; job < arguments.jobs; ++job)
        if (::fork() == 0) {
            int status = 0;
            try {
                work(arguments, counts, job);
            } catch (const std::exception& exception) {
                std::cerr << "board: " << exception.what() << "\n";
                status = 1;
            }
            std::fflush(nullptr);
            ::_exit(status);
        }
    bool failed = false;
    for (int status = 0; ::wait(&status) > 0;) {
        if (WIFEXITED(status) && WEXITSTATUS(status) == 0) continue;
        print("board: one of its processes did not come to its end\n");
        failed = true;
    }
    std::vector<TableRow> table;
    for (size_t i = 0; i < arguments.rows.size(); ++i) {
        table.push_back({arguments.rows[i].name, arguments.rows[i].fault, counts[i].cases, counts[i].failures,
                         counts[i].late, arguments.seeds, arguments.every > 1 || counts[i].cut});
        failed |= counts[i].failures > 0 || counts[i].cases == 0;
    }
    print(textOf(table));
    if (!arguments.table.empty()) putInto(arguments.table, table);
    return failed ? 1 : 0;
}

} // namespace
} // namespace rolvane::board

int main(int argc, char** argv) {
    return rolvane::board::run(rolvane::board::argumentsOf(argc, argv));
}
