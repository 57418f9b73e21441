// Worlds of three people around one shared tree, with faults, kills, outages and full disks, made by a seed each. See
// docs/reliability.md.

#include "World.h"
#include "foundation/CXException.h"
#include "support/TempHome.h"

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <iostream>
#include <new>
#include <sstream>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

namespace rolvane::worlds {
namespace {

constexpr const char* kUsage = R"(usage: worlds [--seeds LIST] [--jobs N] [--second] [--without WHAT,...]
              [--steps N] [--keep DIRECTORY] [--keep-all] [--copies]

Each seed is a world: an owner, a writer and a reader, who edit while requests fail, daemons are killed, the store is
away and disks are full. In the end everybody's copy, the store and a plain model must be equal. A line a world, then a
table; exit status 1 when anything differs.

  --seeds    which worlds: numbers and ranges, as 1..20,33 (1..20)
  --jobs     how many at a time (1)
  --second   the owner has a second computer, which joins in one of the first steps: other worlds than without it
  --without  leaves out: kills, faults, outages, disks, refusals, nesting, writer, overlap,
             last: the last contact is never deleted, single kinds of faults: 500, 503, 412, 423, 403, 404, reset,
             time-out, portal, "lost answer", "cut answer", and locks: those at LOCK and UNLOCK, and merging: where
             both have edited one contact either version may stand; of second computers: sides (both daemons at
             once), backups (older states put back), rights (changed on both)
  --steps    how many steps a world has, instead of as its seed says
  --keep     where the files and the story of each world that differs are put; with --keep-all, of every one
  --copies   everybody's database and the tree as each pass leaves them are kept there, too
)";

struct Totals {
    std::atomic<uint64_t> next = 0;
    std::atomic<size_t> worlds = 0, differing = 0, edits = 0, conflicts = 0, passes = 0, kills = 0, faults = 0,
                        away = 0, diskFailures = 0, refusals = 0, exceptions = 0, threeRounds = 0, restored = 0,
                        sideBySide = 0, milliseconds = 0;
};

struct Arguments {
    std::vector<uint64_t> seeds;
    int jobs = 1;
    Options options;
};

[[noreturn]] void misuse(const std::string& what) {
    std::cerr << "worlds: " << what << "\n" << kUsage;
    std::exit(2);
}

uint64_t numberOf(const std::string& text) {
    char* end = nullptr;
    const uint64_t number = std::strtoull(text.c_str(), &end, 10);
    if (text.empty() || *end != '\0') misuse("\"" + text + "\" is no number");
    return number;
}

std::vector<uint64_t> seedsOf(const std::string& text) {
    std::vector<uint64_t> seeds;
    std::istringstream list(text);
    for (std::string each; std::getline(list, each, ',');) {
        const size_t dots = each.find("..");
        const uint64_t first = numberOf(each.substr(0, dots));
        const uint64_t last = dots == std::string::npos ? first : numberOf(each.substr(dots + 2));
        for (uint64_t seed = first; seed <= last; ++seed) seeds.push_back(seed);
    }
    return seeds;
}

Arguments argumentsOf(int argc, char** argv) {
    Arguments a;
    a.seeds = seedsOf("1..20");
    for (int i = 1; i < argc; ++i) {
        const std::string name = argv[i];
        if (name == "--help") {
            std::cout << kUsage;
            std::exit(0);
        }
        if (name == "--keep-all") {
            a.options.keepAll = true;
            continue;
        }
        if (name == "--copies") {
            a.options.copies = true;
            continue;
        }
        if (name == "--second") {
            a.options.second = true;
            continue;
        }
        if (i + 1 == argc) misuse(name + " needs a value");
        const std::string value = argv[++i];
        if (name == "--seeds") {
            a.seeds = seedsOf(value);
        } else if (name == "--jobs") {
            a.jobs = static_cast<int>(numberOf(value));
        } else if (name == "--steps") {
            a.options.steps = static_cast<int>(numberOf(value));
        } else if (name == "--keep") {
            a.options.keep = value;
        } else if (name == "--without") {
            std::istringstream list(value);
            for (std::string each; std::getline(list, each, ',');) a.options.without.insert(each);
        } else {
            misuse("there is no option " + name);
        }
    }
    if (a.seeds.empty() || a.jobs < 1) misuse("there is nothing to do");
    return a;
}

void print(const Outcome& o) {
    char line[512];
    std::snprintf(line, sizeof line,
                  "world %llu: %zu edits (%zu conflicts), %zu passes, %zu kills, %zu faults, %zu requests while away, "
                  "%zu disk failures, %zu refusals, %.1f s, %zu rounds: %s\n",
                  static_cast<unsigned long long>(o.seed), o.edits, o.conflicts, o.passes, o.kills, o.faults, o.away,
                  o.diskFailures, o.refusals, o.seconds, o.cleanPasses, o.differences.empty() ? "equal" : "DIFFERS");
    std::string all = line;
    size_t shown = 0;
    for (const std::string& difference : o.differences)
        if (++shown <= 12) all += "    " + difference + "\n";
    if (shown > 12) all += "    and " + std::to_string(shown - 12) + " more\n";
    [[maybe_unused]] const ssize_t n = ::write(STDOUT_FILENO, all.data(), all.size());
}

void add(Totals& totals, const Outcome& o) {
    ++totals.worlds;
    totals.differing += o.differences.empty() ? 0 : 1;
    totals.edits += o.edits;
    totals.conflicts += o.conflicts;
    totals.passes += o.passes;
    totals.kills += o.kills;
    totals.faults += o.faults;
    totals.away += o.away;
    totals.diskFailures += o.diskFailures;
    totals.refusals += o.refusals;
    totals.exceptions += o.exceptions;
    totals.restored += o.restored;
    totals.sideBySide += o.sideBySide;
    totals.threeRounds += o.cleanPasses > 2 ? 1 : 0;
    totals.milliseconds += static_cast<size_t>(o.seconds * 1000);
}

// A process with a store of its own, and world after world on it.
void work(const Arguments& arguments, Totals& totals) {
    const test::TempHome home;
    PrivateStoreOptions options;
    options.stateDirectory = home.path() + "/store";
    options.ownsProcess = true;
    PrivateStore store(options);
    store.start();
    for (uint64_t next = 0; (next = totals.next++) < arguments.seeds.size();) {
        Outcome outcome;
        {
            World world(store, arguments.seeds[next], arguments.options);
            outcome = world.run();
        }
        print(outcome);
        add(totals, outcome);
    }
}

int run(const Arguments& arguments) {
    void* shared = ::mmap(nullptr, sizeof(Totals), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
    if (shared == MAP_FAILED) misuse("there is no memory");
    auto* totals = new (shared) Totals;
    bool failed = false;
    for (int job = 0; job < arguments.jobs; ++job)
        if (::fork() == 0) {
            int status = 0;
            try {
                work(arguments, *totals);
            } catch (const CXException& exception) {
                std::cerr << "worlds: " << exception.reason() << "\n";
                status = 1;
            }
            std::fflush(nullptr);
            ::_exit(status);
        }
    for (int status = 0; ::wait(&status) > 0;) failed |= !WIFEXITED(status) || WEXITSTATUS(status) != 0;
    const Totals& t = *totals;
    std::printf("\n%zu worlds: %zu equal, %zu differ\n", t.worlds.load(), t.worlds - t.differing, t.differing.load());
    std::printf("edits %zu, of which in conflict %zu; passes under fire %zu; kills %zu; faults at requests %zu;\n"
                "requests while the store was away %zu; failed writes to disk %zu; refusals %zu; passes ended by an "
                "exception %zu;\nworlds that took three rounds %zu; seconds a world %.1f\n",
                t.edits.load(), t.conflicts.load(), t.passes.load(), t.kills.load(), t.faults.load(), t.away.load(),
                t.diskFailures.load(), t.refusals.load(), t.exceptions.load(), t.threeRounds.load(),
                t.worlds == 0 ? 0.0 : static_cast<double>(t.milliseconds) / 1000 / static_cast<double>(t.worlds));
    if (arguments.options.second)
        std::printf("steps with both daemons at once %zu; former states put back %zu\n", t.sideBySide.load(),
                    t.restored.load());
    failed |= t.worlds != arguments.seeds.size();
    return failed || t.differing > 0 ? 1 : 0;
}

} // namespace
} // namespace rolvane::worlds

int main(int argc, char** argv) {
    return rolvane::worlds::run(rolvane::worlds::argumentsOf(argc, argv));
}
