#include "DamageRows.h"

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <iterator>

namespace rolvane::board {

namespace {

namespace fs = std::filesystem;

constexpr size_t kCases = 5000;

// Edits that take nothing away.
worlds::Habits additions() {
    worlds::Habits habits;
    habits.remove = habits.removeGroup = habits.leave = habits.unnest = habits.turn = 0;
    habits.phone = 0; // one in three takes a number away
    return habits;
}

// The person's database and its log, the account, the settings, and what else the daemon remembers. The database is
// taken as often as all the others together.
std::vector<fs::path> filesOf(const std::string& home) {
    std::vector<fs::path> databases, others;
    for (const auto& entry : fs::recursive_directory_iterator(home)) {
        if (!entry.is_regular_file() || entry.file_size() == 0) continue;
        const std::string name = entry.path().filename().string();
        if (name.ends_with("-shm") || name.ends_with(".pem"))
            continue; // no content of its own; the store's certificate
        (name.starts_with("contacts.db") ? databases : others).push_back(entry.path());
    }
    std::sort(databases.begin(), databases.end());
    std::sort(others.begin(), others.end());
    std::vector<fs::path> all = others;
    for (size_t i = 0; !databases.empty() && i < std::max<size_t>(1, others.size()); ++i)
        all.push_back(databases[i % databases.size()]);
    return all;
}

// A bit turns, bytes become nothing, or others, or the file ends early.
std::string damaged(std::string bytes, worlds::Chance& chance) {
    constexpr size_t kKinds = 5, kSector = 512;
    const size_t at = chance.below(bytes.size());
    const auto overwrite = [&](size_t from, size_t length, bool withNothing) {
        for (size_t i = from; i < std::min(from + length, bytes.size()); ++i)
            bytes[i] = withNothing ? '\0' : static_cast<char>(chance.next());
    };
    switch (chance.below(kKinds)) {
    case 0: bytes[at] = static_cast<char>(bytes[at] ^ (1 << chance.below(8))); break;
    case 1: bytes[at] = static_cast<char>(chance.next()); break;
    case 2: overwrite(at, 1 + chance.below(64), true); break;
    case 3: overwrite(at / kSector * kSector, kSector, chance.happens(0.5)); break;
    default: bytes.resize(at); break;
    }
    return bytes;
}

template <class Parts>
void missing(const Parts& before, const Parts& now, const std::string& where, std::vector<std::string>& wrong) {
    for (const auto& [name, part] : before)
        if (!now.contains(name)) wrong.push_back(name + " is gone from " + where);
}

// Nothing that was there is away: nobody, no group, no value of a text, no phone, and nobody from a group.
void compare(const worlds::View& before, const worlds::View& now, const std::string& where,
             std::vector<std::string>& wrong) {
    missing(before.people, now.people, where, wrong);
    missing(before.groups, now.groups, where, wrong);
    for (const auto* parts : {&before.people, &before.groups})
        for (const auto& [name, cells] : *parts) {
            const auto& there = parts == &before.people ? now.people : now.groups;
            if (const auto found = there.find(name); found != there.end())
                missing(cells, found->second, where + ": " + name, wrong);
        }
}

} // namespace

void damageOnce(Work& work, size_t number) {
    Stage& stage = work.stage;
    stage.forgetStory();
    stage.bringBack("in-step");
    worlds::Chance chance(worlds::hashOf("damage", stage.seed() * 10000 + number));
    const char role = chance.happens(0.6) ? 'o' : 'w';
    if (chance.happens(0.5)) stage.edit(role, additions(), "d" + std::to_string(number));
    const worlds::View store = stage.storeView(), reader = stage.view('r');
    const fs::path file = chance.oneOf(filesOf(stage.home(role)));
    std::ifstream in(file, std::ios::binary);
    const std::string bytes{std::istreambuf_iterator<char>(in), {}};
    std::ofstream(file, std::ios::binary | std::ios::trunc) << damaged(bytes, chance);
    const std::string name =
        std::string(1, role) + "'s " + file.filename().string() + " damaged, number " + std::to_string(number);
    stage.tell("   DAMAGE " + name);

    std::vector<std::string> wrong;
    (void)stage.writesToTheStore();
    const Ending ending = stage.pass(role);
    if (ending.late) wrong.push_back("the pass does not end");
    if (ending.signal != 0) wrong.push_back("the pass ended by signal " + std::to_string(ending.signal));
    const bool wrote = !stage.writesToTheStore().empty();
    compare(store, stage.storeView(), "the store", wrong);
    if (wrote) {
        (void)stage.pass('r');
        compare(reader, stage.view('r'), "the reader's copy", wrong);
    }
    for (const std::string& each : wrong) stage.tell("!! " + each);
    ++work.count.cases;
    if (wrong.empty()) return;
    ++work.count.failures;
    work.failed(name, wrong);
}

void damage(Work& work) {
    for (size_t number = 0; number < kCases; ++number) {
        if (!work.isMine(number)) continue;
        if (work.timeIsOver()) return;
        damageOnce(work, number);
    }
}

} // namespace rolvane::board
