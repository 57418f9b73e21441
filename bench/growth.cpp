// CPU seconds of the steps whose cost must grow with the size of the database and no faster. One size a process, so
// that sizes do not warm each other's caches; `bench/run` compares sizes.
//
//   growth CARDS-FILE DIRECTORY
//
// The directory gets a contact database and preferences. Prints one line of JSON: step -> CPU seconds of this process.

#include "FakeEngine.h"
#include "conduits/CXDCXConduit.h"
#include "contacts/CXRolvane.h"
#include "contacts/Constants.h"
#include "contacts/VCardImport.h"
#include "engine/ChangeQueue.h"
#include "engine/EngineState.h"
#include "engine/Mingler.h"
#include "engine/PublicationCache.h"
#include "foundation/Preferences.h"

#include <algorithm>
#include <ctime>
#include <iostream>
#include <nlohmann/json.hpp>

using namespace rolvane;

namespace {

const RemoteLocation kLocation("http://store.example/ada/Contacts");

double cpuSeconds() {
    timespec time{};
    clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &time);
    return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) / 1e9;
}

class Steps {
public:
    template <class Step>
    void time(const char* name, Step&& step) {
        const double began = cpuSeconds();
        step();
        _seconds[name] = cpuSeconds() - began;
    }
    void say(const char* name, double value) { _seconds[name] = value; }
    void print() const { std::cout << _seconds << "\n"; }

private:
    nlohmann::json _seconds;
};

void publishEverything(CXRolvane& database) {
    CXMutableMultiValue locations;
    locations.addValue(Value(kLocation), kCXPublishLabel);
    database.allGroup()->setValue(CXMultiValue(locations), kCXRemoteLocationProperty);
    database.save();
}

void measure(const std::string& cards, const std::string& directory) {
    Steps steps;
    CXRolvane::Options options;
    options.path = directory + "/contacts.db";
    CXRolvane database(options);
    Preferences preferences(directory + "/preferences.db");
    NotificationCenter center;
    Clock& clock = Clock::system();
    test::FakeEngine engine;
    EngineState state(preferences);

    steps.time("import", [&] { VCardImport::importFile(database, cards); });
    publishEverything(database);

    CXDCXConduit conduit(engine, {database, preferences, clock, center});
    CXDChangeRecords captured;
    conduit.open();
    steps.time("first scan", [&] { captured = conduit.changeRecords(); });
    steps.say("captured records", static_cast<double>(captured.size()));

    CXDChangeRecords mingled;
    steps.time("mingling", [&] {
        Mingler mingler;
        for (const CXDChangeRecordPtr& record : captured) mingler.mingle(record);
        mingled = mingler.takeMingled();
    });
    captured.clear();

    CXDChangeRecords flat;
    steps.time("flattening and sorting", [&] {
        flat = flattenGroupChanges(mingled);
        std::stable_sort(flat.begin(), flat.end(),
                         [](const CXDChangeRecordPtr& a, const CXDChangeRecordPtr& b) { return a->compare(*b) < 0; });
    });
    mingled.clear();

    steps.time("writing a full queue", [&] { state.setPendingChanges(flat); });
    steps.time("reading a full queue", [&] { flat = state.getPendingChanges(); });
    state.setPendingChanges({});

    steps.time("folding into the prior state", [&] {
        for (const CXDChangeRecordPtr& record : flat)
            state.withConduitData([&](Dictionary& data) { didApplyChange(data, *record, CXDSyncSourceVaultra); });
    });
    flat.clear();
    steps.time("writing the conduit data", [&] { state.syncPrefs(); });

    for (const char* key : {kConduitCX, kConduitVaultra}) engine.data.set(key, state.conduitData()[key]);
    conduit.close();
    conduit.open();
    steps.time("scan without changes", [&] { captured = conduit.changeRecords(); });
    steps.say("captured without changes", static_cast<double>(captured.size()));
    steps.print();
}

} // namespace

int main(int argc, char** argv) {
    if (argc != 3) {
        std::cerr << "usage: growth CARDS-FILE DIRECTORY\n";
        return 2;
    }
    try {
        measure(argv[1], argv[2]);
        return 0;
    } catch (const CXException& error) {
        std::cerr << "growth: " << error.reason() << "\n";
    } catch (const std::exception& error) {
        std::cerr << "growth: " << error.what() << "\n";
    }
    return 1;
}
