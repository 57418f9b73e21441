// CPU seconds of the steps whose cost must grow with the size of the database and no faster. One size a process, so
// that sizes do not warm each other's caches; `bench/run` compares sizes.
//
// A pass does each step once, after other work. So before every repetition of every step the processor's caches are
// emptied and the free memory goes back to the kernel: 10,000 people do not find their data in a cache that 100,000 do
// not fit into, and both pay for fresh memory. What writes state finds a new state file. Each step's fastest time
// counts, because other load can only slow a step down; what changes the database is done once.
//
//   growth CARDS-FILE DIRECTORY [REPETITIONS]
//
// The directory gets contact databases and preferences. Prints one line of JSON: step -> CPU seconds of this process.

#include "FakeEngine.h"
#include "conduits/database/CXDCXConduit.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "contacts/vcard/VCardImport.h"
#include "engine/memory/EngineState.h"
#include "engine/memory/PriorStates.h"
#include "engine/queue/ChangeQueue.h"
#include "engine/queue/Mingler.h"
#include "foundation/BinaryValue.h"
#include "foundation/FreeMemory.h"
#include "foundation/Preferences.h"
#include "foundation/PropertyList.h"
#include "model/PayloadKeys.h"

#include <algorithm>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <iostream>
#include <nlohmann/json.hpp>
#include <sys/resource.h>
#include <vector>

using namespace rolvane;

namespace {

const RemoteLocation kLocation("http://store.example/ada/Contacts");

double cpuSeconds() {
    timespec time{};
    clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &time);
    return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) / 1e9;
}

double wallSeconds() {
    timespec time{};
    clock_gettime(CLOCK_MONOTONIC, &time);
    return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) / 1e9;
}

// More than any cache of a core, and than what a shared last level leaves to one program.
constexpr size_t kOtherWork = 256u << 20;

class Steps {
public:
    explicit Steps(int repetitions) : _repetitions(repetitions), _otherWork(kOtherWork) {}
    template <class Step>
    void once(const char* name, Step&& step) {
        _seconds[name] = timed(step);
    }
    // `prepare` is not timed.
    template <class Prepare, class Step>
    void time(const char* name, Prepare&& prepare, Step&& step) {
        double best = 0;
        for (int i = 0; i < _repetitions; ++i) {
            prepare();
            const double taken = timed(step);
            best = i == 0 ? taken : std::min(best, taken);
        }
        _seconds[name] = best;
    }
    void say(const char* name, double value) { _seconds[name] = value; }
    void print() const { std::cout << _seconds << "\n"; }

private:
    template <class Step>
    double timed(Step& step) {
        returnFreeMemory();
        for (size_t i = 0; i < _otherWork.size(); i += kCacheLine) ++_otherWork[i];
        const double began = cpuSeconds();
        step();
        return cpuSeconds() - began;
    }
    static constexpr size_t kCacheLine = 64;

    int _repetitions;
    std::vector<unsigned char> _otherWork;
    nlohmann::json _seconds;
};

void publishEverything(CXRolvane& database) {
    CXMutableMultiValue locations;
    locations.addValue(Value(kLocation), kCXPublishLabel);
    database.allGroup()->setValue(CXMultiValue(locations), kCXRemoteLocationProperty);
    database.save();
}

// A state file that nothing has been written to but a mark.
void beginStateFile(Preferences& preferences) {
    for (const char* part : {"", "-wal", "-shm"}) std::filesystem::remove(preferences.path() + part);
    preferences.set("growth", "mark", true); // they notice that their file is gone
    preferences.synchronize("growth");
}

// A daemon that has just been started: nothing of the database is in its cache.
struct Reader {
    Reader(const CXRolvane::Options& options, ConduitEngine& engine, Preferences& preferences,
           NotificationCenter& center)
        : database(options), conduit(engine, {database, preferences, Clock::system(), center}) {
        conduit.open();
    }
    CXRolvane database;
    CXDCXConduit conduit;
};

double peakMegabytes() {
    rusage usage{};
    getrusage(RUSAGE_SELF, &usage);
    return static_cast<double>(usage.ru_maxrss) / 1024 - static_cast<double>(kOtherWork >> 20);
}

// A publisher's data as a subscriber receives it, applied to a new database: one update and one entry into the
// all-contacts group a person, and every person a member of one of twenty groups.
void measureApplying(Steps& steps, CXRolvane& publisher, const std::string& directory) {
    const RemoteLocation location("http://store.example/bob/Contacts");
    const UserName bob("bob");
    CXRolvane::Options options;
    options.path = directory + "/subscribed.db";
    options.program = "RolvaneManager";
    CXRolvane database(options);
    database.addRecord(CXSubscription::create(location));
    database.save();
    Preferences preferences(directory + "/subscribed-preferences.db");
    NotificationCenter center;
    test::FakeEngine engine;
    CXDCXConduit conduit(engine, {database, preferences, Clock::system(), center});
    std::vector<CXRow> people;
    publisher.forEachPersonModifiedSince(Date::distantPast(), kCXPersonTable,
                                         [&](const CXRow& row) { people.push_back(row); });

    const auto apply = [&](int type, std::optional<UniqueId> person, std::optional<UniqueId> group,
                           Value payload = {}) {
        const auto record =
            std::make_shared<CXDChangeRecord>(CXDSyncSourceVaultra, type, bob, person, group, std::move(payload));
        if (conduit.applyChangeRecord(record)) didApplyChange(engine.data, *record, CXDSyncSourceCX);
    };
    const auto copyOf = [](const CXRow& row) { return cxUIDWithTableName(row.uniqueId, kCXSubscribedPersonTable); };
    const auto groupOf = [](size_t i) { return UniqueId(std::to_string(i % 20) + ":CXSubscribedGroup"); };
    const auto updateAll = [&] {
        for (const CXRow& row : people) {
            Dictionary content = BinaryValue::decode(*row.encoded).dictionary();
            conduit.stampWithRemoteLocation(content, location);
            apply(CXDUpdateRecord, copyOf(row), std::nullopt, content);
        }
    };
    // A save is made whenever so much is unsaved, so what applying costs is known with the last save.
    conduit.open();
    steps.once("receiving new people", [&] {
        updateAll();
        database.save();
    });
    steps.once("receiving members", [&] {
        for (size_t i = 0; i < 20; i++)
            apply(CXDCreateStructureForGroup, std::nullopt, groupOf(i), Dictionary{{kCXGroupNameProperty, "Group"}});
        for (size_t i = 0; i < people.size(); i++) {
            apply(CXDAddRecordToGroup, copyOf(people[i]), UniqueId(kCXAllGroupUID));
            apply(CXDAddRecordToGroup, copyOf(people[i]), groupOf(i));
        }
        conduit.close();
    });
    conduit.open();
    steps.once("receiving known people", [&] {
        updateAll();
        const double began = wallSeconds();
        conduit.close();
        steps.say("seconds in which nobody else could save", wallSeconds() - began);
    });
    {
        Reader next(options, engine, preferences, center);
        steps.once("scan after applying", [&] { next.conduit.changeRecords(); });
    }
    conduit.open();
    steps.once("receiving removals", [&] {
        for (const CXRow& row : people) apply(CXDRemoveRecordFromGroup, row.uniqueId, UniqueId(kCXAllGroupUID));
        conduit.close();
    });
    steps.say("people left", static_cast<double>(database.countPeople(location)));
    steps.say("peak megabytes", peakMegabytes());
}

// Everybody leaves the all-contacts group, one record a person, and the state is written.
void removeMembers(Steps& steps, EngineState& state) {
    CXDChangeRecords leaving;
    const auto prepare = [&] {
        state.dropConduitData();
        leaving.clear();
        const Dictionary groups =
            state.conduitData()[kConduitVaultra].dictionary()[kPriorState].dictionary()["<self>"].dictionary();
        for (const Value& member : groups[std::string(kCXAllGroupUID)].dictionary()[kMemberUIDState].array())
            leaving.push_back(std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDRemoveRecordFromGroup, kSelf,
                                                                UniqueId(member.string()), UniqueId(kCXAllGroupUID)));
    };
    steps.time("removing all members singly", prepare, [&] {
        for (const CXDChangeRecordPtr& record : leaving)
            state.withConduitData([&](Dictionary& data) { didApplyChange(data, *record, CXDSyncSourceVaultra); });
        BinaryValue::encode(state.conduitData());
    });
    steps.say("members removed", static_cast<double>(leaving.size()));
}

void measure(const std::string& cards, const std::string& directory, int repetitions) {
    Steps steps(repetitions);
    CXRolvane::Options options;
    options.path = directory + "/contacts.db";
    options.program = "rolvane";
    const auto application = std::make_unique<CXRolvane>(options);
    Preferences preferences(directory + "/preferences.db");
    NotificationCenter center;
    test::FakeEngine engine;
    EngineState state(preferences);

    steps.once("import", [&] { VCardImport::importFile(*application, cards); });
    publishEverything(*application);

    options.program = "RolvaneManager";
    std::unique_ptr<Reader> reader;
    CXDChangeRecords captured, mingled, flat;
    const auto begin = [&] {
        captured.clear();
        reader.reset();
        reader = std::make_unique<Reader>(options, engine, preferences, center);
    };
    steps.time("first scan", begin, [&] { captured = reader->conduit.changeRecords(); });
    steps.say("captured records", static_cast<double>(captured.size()));

    steps.time(
        "mingling", [&] { mingled.clear(); },
        [&] {
            Mingler mingler;
            mingler.mingle(captured);
            mingled = mingler.takeMingled();
        });
    captured.clear();
    steps.time(
        "flattening and sorting", [&] { flat.clear(); },
        [&] {
            flat = flattenGroupChanges(mingled);
            sortByType(flat);
        });
    mingled.clear();

    steps.time(
        "writing a full queue", [&] { beginStateFile(preferences); }, [&] { state.setPendingChanges(flat); });
    steps.time(
        "reading a full queue", [&] { flat.clear(); }, [&] { flat = state.getPendingChanges(); });
    state.setPendingChanges({});

    const auto forget = [&] {
        state.withConduitData([](Dictionary& data) {
            for (const std::string& key : data.allKeys()) data.remove(key);
        });
    };
    steps.time("folding into the prior state", forget, [&] {
        for (const CXDChangeRecordPtr& record : flat)
            state.withConduitData([&](Dictionary& data) { didApplyChange(data, *record, CXDSyncSourceVaultra); });
    });
    flat.clear();
    const auto beginStates = [&] {
        beginStateFile(preferences);
        state.forgetPut(); // else rows that the former file has are not written into this one
    };
    steps.time("writing the conduit data", beginStates, [&] { state.syncPrefs(); });
    steps.time(
        "reading the conduit data", [&] { state.dropConduitData(); }, [&] { state.conduitData(); });

    for (const char* key : {kConduitCX, kConduitVaultra}) engine.data.set(key, state.conduitData()[key]);
    reader->conduit.close();
    steps.time("scan without changes", begin, [&] { captured = reader->conduit.changeRecords(); });
    steps.say("captured without changes", static_cast<double>(captured.size()));

    removeMembers(steps, state);
    measureApplying(steps, reader->database, directory);
    steps.print();
}

} // namespace

int main(int argc, char** argv) {
    if (argc != 3 && argc != 4) {
        std::cerr << "usage: growth CARDS-FILE DIRECTORY [REPETITIONS]\n";
        return 2;
    }
    shareHeaps(); // like the daemon
    try {
        measure(argv[1], argv[2], argc == 4 ? std::atoi(argv[3]) : 5);
        return 0;
    } catch (const CXException& error) {
        std::cerr << "growth: " << error.reason() << "\n";
    } catch (const std::exception& error) {
        std::cerr << "growth: " << error.what() << "\n";
    }
    return 1;
}
