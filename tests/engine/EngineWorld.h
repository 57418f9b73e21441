#pragma once

#include "Records.h"
#include "conduits/CXDConduit.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/database/DaemonMemory.h"
#include "engine/CXDSyncEngine.h"
#include "engine/memory/EngineState.h"
#include "foundation/Preferences.h"
#include "foundation/RunLoop.h"
#include "model/RemoteLocationMap.h"
#include "support/TempHome.h"

#include <algorithm>
#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <vector>

namespace rolvane::test {

// What happened, in order, on whatever thread.
class Events {
public:
    void add(std::string event) {
        const std::lock_guard guard(_lock);
        _all.push_back(std::move(event));
    }
    std::vector<std::string> all() const {
        const std::lock_guard guard(_lock);
        return _all;
    }
    size_t count(const std::string& event) const {
        const auto events = all();
        return static_cast<size_t>(std::count(events.begin(), events.end(), event));
    }
    void clear() {
        const std::lock_guard guard(_lock);
        _all.clear();
    }

private:
    mutable std::mutex _lock;
    std::vector<std::string> _all;
};

// The process's end: nothing runs after it.
struct Ended {
    int status;
};
class ThrowingEnd : public ProcessEnd {
public:
    [[noreturn]] void end(int status) override { throw Ended{status}; }
};

class FakeAccount : public NetworkAccount {
public:
    std::optional<UserName> user = UserName("ann");
    Value threads;
    int updates = 0;
    std::function<void()> failedPassword;
    std::optional<UserName> vaultraUser() const override { return user; }
    Value configValueForKey(const std::string& key, Value defaultValue) const override {
        return key == "CXDThreadCountKey" && threads ? threads : defaultValue;
    }
    void updateConfigDataIfNeeded() override { ++updates; }
    void setFailedPasswordHandler(std::function<void()> handler) override { failedPassword = std::move(handler); }
};

class RecordingProgress : public ProgressReporter {
public:
    explicit RecordingProgress(Events& events) : _events(events) {}
    void startedPhase(int32_t phase) override { _events.add("phase " + std::to_string(phase)); }
    void willProcessChangeRecord(const CXDChangeRecordPtr&) override { ++will; }
    void didProcessChangeRecord(const CXDChangeRecordPtr&) override { ++did; }
    void stop() override { _events.add("stop"); }
    std::atomic<int> will{0}, did{0};

private:
    Events& _events;
};

// A source that keeps what it is given and does what the test says.
class FakeConduit : public CXDConduit {
public:
    FakeConduit(ConduitEngine& engine, Events& events, std::string id, int32_t source)
        : CXDConduit(engine), _events(events), _id(std::move(id)), _source(source) {}
    std::function<bool(const CXDChangeRecordPtr&, bool*)> whenApplying; // none: true
    std::function<CXDChangeRecords()> whenGathering;
    std::function<void()> whenOpening, whenClosing, whenLocating;

    std::optional<std::string> conduitID() const override { return _id; }
    int32_t conduitSource() const override { return _source; }
    std::optional<UserName> realUserFromUser(const std::optional<UserName>& user) const override {
        return user == kSelf ? UserName("ann") : user;
    }
    std::optional<Url> baseLocationForUser(const std::optional<UserName>& user) const override {
        if (whenLocating) whenLocating();
        if (_source != CXDSyncSourceVaultra || !user) return std::nullopt;
        return Url("http://store.example").cxURLByAppendingComponent(user->str()).cxURLByAppendingComponent("Contacts");
    }
    using CXDConduit::applyChangeRecord;
    bool applyChangeRecord(const CXDChangeRecordPtr& record, bool* denied) override {
        {
            const std::lock_guard guard(_lock);
            _applied.push_back(record);
            _threads.insert(std::this_thread::get_id());
        }
        return !whenApplying || whenApplying(record, denied);
    }
    void open() override {
        _events.add(_id + " open");
        if (whenOpening) whenOpening();
    }
    void willClose() override { _events.add(_id + " will close"); }
    void close() override {
        _events.add(_id + " close");
        CXDConduit::close();
        if (whenClosing) whenClosing();
    }
    CXDChangeRecords changeRecords() override {
        _events.add(_id + " gather");
        return whenGathering ? whenGathering() : CXDChangeRecords();
    }

    // The persons (or groups) of what was applied, in order.
    std::vector<std::string> applied() const {
        const std::lock_guard guard(_lock);
        std::vector<std::string> names;
        for (const CXDChangeRecordPtr& r : _applied) names.push_back(nameOf(*r));
        return names;
    }
    // Each with its change type behind it, in no order.
    std::multiset<std::string> appliedWithTypes() const {
        const std::lock_guard guard(_lock);
        std::multiset<std::string> all;
        for (const CXDChangeRecordPtr& r : _applied) all.insert(nameOf(*r) + " " + std::to_string(r->type()));
        return all;
    }
    size_t threads() const {
        const std::lock_guard guard(_lock);
        return _threads.size();
    }
    bool appliedOnlyOn(std::thread::id thread) const {
        const std::lock_guard guard(_lock);
        return _threads == std::set{thread};
    }

private:
    static std::string nameOf(const CXDChangeRecord& record) {
        return record.person() ? record.person()->str() : record.group() ? record.group()->str() : "";
    }
    Events& _events;
    std::string _id;
    int32_t _source;
    mutable std::mutex _lock;
    CXDChangeRecords _applied;
    std::set<std::thread::id> _threads;
};

class RecordingLock : public CXWebDAVLock {
public:
    RecordingLock(Events& events, const Clock& clock, Url url) : _events(events), _clock(clock), _url(std::move(url)) {}
    bool tryLock() override {
        _events.add("lock");
        return _locked = true;
    }
    void unlock() override {
        _events.add("unlock");
        _locked = false;
    }
    bool renew() override { return true; }
    bool locked() const override { return _locked; }
    Date expires() const override { return _clock.now().addingSeconds(300); }
    const Url& url() const override { return _url; }

private:
    Events& _events;
    const Clock& _clock;
    Url _url;
    std::atomic<bool> _locked{false};
};

// A daemon's surroundings with a real database, real preferences and two fake sources. The owner has the account "ann"
// and publishes.
class World {
public:
    // `at`: a directory that outlives the world, for what is started again.
    explicit World(bool publishes = true, std::string at = {})
        : root(at.empty() ? directory.emplace().path() : std::move(at)) {
        CXRolvane::Options options;
        options.path = root + "/contacts.db";
        options.program = "RolvaneManager";
        options.clock = &clock;
        options.center = &center;
        options.distributed = &distributed;
        rolvane = std::make_unique<CXRolvane>(options);
        if (publishes) publish();
    }
    ~World() { engine.reset(); }

    void publish() {
        CXMutableMultiValue locations;
        locations.addValue("http://store.example/ann/Contacts", kCXPublishLabel);
        rolvane->allGroup()->setValue(locations, kCXRemoteLocationProperty);
        rolvane->save();
    }
    void subscribe(const std::string& location) {
        rolvane->addRecord(CXSubscription::create(RemoteLocation(location)));
        rolvane->save();
    }
    EngineCollaborators collaborators() {
        return {*rolvane,
                preferences,
                distributed,
                loop,
                clock,
                progress,
                processEnd,
                account,
                idleExit,
                [this](const Url& url) { return std::make_shared<RecordingLock>(events, clock, url); },
                [this](ConduitEngine& owner) {
                    EngineConduits made;
                    auto contacts = std::make_unique<FakeConduit>(owner, events, kConduitCX, CXDSyncSourceCX);
                    auto network = std::make_unique<FakeConduit>(owner, events, kConduitVaultra, CXDSyncSourceVaultra);
                    cx = contacts.get();
                    vaultra = network.get();
                    made.cx = std::move(contacts);
                    made.vaultra = std::move(network);
                    made.vaultraOffLine = [this] { return offLine; };
                    if (prepare) prepare();
                    return made;
                },
                "annlogin",
                nullptr};
    }
    CXDSyncEngine& start() {
        engine.reset();
        engine = std::make_unique<CXDSyncEngine>(collaborators());
        return *engine;
    }
    // As another program of the user: what is saved here reaches the daemon through the journal.
    std::unique_ptr<CXRolvane> application() {
        CXRolvane::Options options;
        options.path = root + "/contacts.db";
        options.program = "rolvane";
        options.clock = &clock;
        options.center = &applicationCenter;
        return std::make_unique<CXRolvane>(options);
    }
    Value stored(const char* key) {
        if (key != std::string_view(kCXDConduitData)) return preferences.get(kDaemonDomain, key);
        const Dictionary data = EngineState(preferences).conduitData(); // which is stored in rows
        return data.empty() ? Value() : Value(data);
    }
    std::vector<std::string> pending() {
        std::vector<std::string> names;
        for (const CXDChangeRecordPtr& r : engine->getPendingChanges())
            names.push_back((r->person() ? r->person()->str() : r->group()->str()) + ":" +
                            std::to_string(r->appliesToSources()));
        return names;
    }
    // Turns the loop until what is scheduled for now has run.
    void turn() { loop.runOnce(0); }

    std::optional<TempDirectory> directory; // none: a killed process could not remove it
    const std::string root;
    ManualClock clock{Date(1000000)};
    NotificationCenter center, applicationCenter;
    LocalNotifications distributed;
    Preferences preferences{root + "/state/preferences.db", daemonMemory(root + "/contacts.db")};
    RunLoop loop;
    Events events;
    RecordingProgress progress{events};
    ThrowingEnd processEnd;
    FakeAccount account;
    IdleExit idleExit;
    bool offLine = false;
    std::function<void()> prepare; // when the conduits have been made
    std::unique_ptr<CXRolvane> rolvane;
    FakeConduit* cx = nullptr;
    FakeConduit* vaultra = nullptr;
    std::unique_ptr<CXDSyncEngine> engine;
};

inline CXDChangeRecordPtr update(const char* person, int32_t appliesTo = CXDSyncSourceVaultra,
                                 const char* user = "<self>") {
    return makeRecord(CXDUpdateRecord, person, nullptr, {CXDSyncSourceCX, appliesTo, user},
                      Dictionary{{"First", person}});
}

} // namespace rolvane::test
