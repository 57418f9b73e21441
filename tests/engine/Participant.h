#pragma once

#include "../store/StoreWorld.h"
#include "EngineWorld.h"
#include "conduits/UserAlert.h"
#include "conduits/WithdrawalNotice.h"
#include "conduits/database/CXDCXConduit.h"
#include "conduits/store/CXDVaultraConduit.h"
#include "contacts/database/DaemonMemory.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "store/account/CXNetworkController.h"

#include <filesystem>
#include <functional>
#include <map>
#include <set>

namespace rolvane::test {

// Signs each request in as the user whose tree it is about: a store on which everybody was granted everything.
class EverybodysKeys : public HttpTransport {
public:
    explicit EverybodysKeys(const StoreWorld& world) : _alice(world.transport("alice")), _bob(world.transport("bob")) {}
    HttpResponse perform(HttpRequest request) override { return of(request).perform(std::move(request)); }
    void start(HttpRequest request, Completion done) override {
        of(request).start(std::move(request), std::move(done));
    }
    void abortAll() override {
        _alice->abortAll();
        _bob->abortAll();
    }
    void resume() override {
        _alice->resume();
        _bob->resume();
    }

private:
    HttpTransport& of(const HttpRequest& request) {
        return request.url.encodedPath().find("/bob/") != std::string::npos ? *_bob : *_alice;
    }
    std::shared_ptr<CurlTransport> _alice, _bob;
};

struct AlwaysReachable : CXNetworkController {
    bool canReachAddress(const std::string&) override { return reachable; }
    bool reachable = true; // unless a test says otherwise
};

struct Told : UserAlert {
    void show(const Text& text) override { told.push_back(text); }
    void tell(const Text& text) override { told.push_back(text); }
    std::vector<Text> told;
};

// The system's clock, ahead by as much as the test says.
struct ClockAhead : Clock {
    Date now() const override { return Clock::system().now().addingSeconds(ahead); }
    double ahead = 0; // seconds
};

struct NoProgress : ProgressReporter {
    void startedPhase(int32_t) override {}
    void willProcessChangeRecord(const CXDChangeRecordPtr&) override {}
    void didProcessChangeRecord(const CXDChangeRecordPtr& record) override {
        if (processed) processed(record);
    }
    void stop() override {}
    std::function<void(const CXDChangeRecordPtr&)> processed;
};

// One user of a store with everything that a daemon has: database, preferences, engine and both conduits. The contact
// application is a second handle on the database.
class Participant {
public:
    // `disk`: the directory of one who was killed, whose files this one goes on with, as they are now.
    Participant(const StoreWorld& world, const std::string& user, const std::string& disk = {})
        : name(user), directory(disk),
          wire(std::make_shared<RecordingTransport>(std::make_shared<EverybodysKeys>(world))),
          manager(world.account(user), wire), base(manager.account().baseLocationFor(UserName(user)).absoluteString()) {
        account.user = UserName(user);
        application = std::make_unique<CXRolvane>(
            CXRolvane::Options{.path = directory / "contacts.db", .program = "rolvane", .center = &applicationCenter});
        start();
    }
    ~Participant() { engine.reset(); }

    // The daemon, anew.
    void start() {
        engine.reset();
        database = std::make_unique<CXRolvane>(
            CXRolvane::Options{.path = directory / "contacts.db", .program = "RolvaneManager", .center = &center});
        pendingEngine = [this] {
            engine = std::make_unique<CXDSyncEngine>(
                EngineCollaborators{*database, preferences, distributed, loop, clock, progress, processEnd, account,
                                    idleExit, [this](const Url& url) { return makeStoreLock(manager, url); },
                                    [this](ConduitEngine& owner) { return conduits(owner); }, name + "login", nullptr});
        };
    }
    // A pass; the engine is made for the first one, when there is a reason for it to live.
    void pass() {
        if (!engine) pendingEngine();
        engine->bringSourcesUpToDate();
    }

    void publish() {
        CXMutableMultiValue locations;
        locations.addValue(base, kCXPublishLabel);
        application->allGroup()->setValue(locations, kCXRemoteLocationProperty);
        application->save();
    }
    void subscribe(const Participant& to) {
        application->addRecord(CXSubscription::create(RemoteLocation(to.base)));
        application->save();
    }
    CXPersonRef add(const std::string& first, const std::string& phone = "1") {
        auto person = CXPerson::create();
        person->setValue(Value(first), kCXFirstNameProperty);
        CXMutableMultiValue phones;
        phones.addValue(phone, "work");
        person->setValue(phones, kCXPhoneProperty);
        application->addRecord(person);
        application->save();
        return person;
    }
    CXGroupRef group(const std::string& groupName, const std::vector<CXPersonRef>& members) {
        auto group = CXGroup::create();
        group->setValue(Value(groupName), kCXGroupNameProperty);
        application->addRecord(group);
        for (const auto& member : members) group->addMember(member);
        application->save();
        return group;
    }
    // What is there of a location ("": the own): the people with their properties, and the groups with their members
    // and subgroups.
    // Written as text, so that two users' views compare.
    std::map<std::string, std::string> view(const std::string& location = {}) const {
        std::map<std::string, std::string> all;
        for (const CXListing& each : application->listPeople(RemoteLocation(location))) {
            Dictionary properties =
                application->recordForUniqueId(each.uniqueId)->dictionaryRepresentation().mutableCopy();
            properties.remove(kCXRemoteLocationProperty);
            all["person " + cxNormalizedUID(each.uniqueId).str()] = Value(properties).description();
        }
        for (const CXListing& each : application->listGroups(RemoteLocation(location))) {
            const auto group = std::dynamic_pointer_cast<CXGroup>(application->recordForUniqueId(each.uniqueId));
            std::set<std::string> members;
            for (const UniqueId& member : group->memberUniqueIds()) members.insert(cxNormalizedUID(member).str());
            std::string text = group->name() + ":";
            for (const std::string& member : members) text += " " + member;
            std::set<std::string> subgroups;
            for (const UniqueId& subgroup : group->subgroupUniqueIds())
                subgroups.insert(cxNormalizedUID(subgroup).str());
            for (const std::string& subgroup : subgroups) text += " +" + subgroup;
            all["group " + cxNormalizedUID(each.uniqueId).str()] = text;
        }
        return all;
    }
    size_t countPeople(const std::string& location = {}) const {
        return application->countPeople(RemoteLocation(location));
    }
    CXPersonRef copyOf(const CXPersonRef& person) const {
        return std::dynamic_pointer_cast<CXPerson>(
            application->recordForUniqueId(cxUIDWithTableName(person->uniqueId(), kCXSubscribedPersonTable)));
    }
    size_t writes() const {
        size_t count = 0;
        for (const auto& exchange : wire->exchanges())
            count += exchange.method != "PROPFIND" && exchange.method != "GET" && exchange.method != "OPTIONS" &&
                     exchange.method != "HEAD" && exchange.method != "REPORT" && !exchange.path.ends_with("/dateFile");
        return count;
    }
    size_t reads(std::string_view below) const { // GET requests
        size_t count = 0;
        for (const auto& exchange : wire->exchanges())
            count += exchange.method == "GET" && exchange.path.find(below) != std::string::npos;
        return count;
    }

    const std::string name;
    struct Directory : TempDirectory {
        explicit Directory(const std::string& disk) {
            if (disk.empty()) return;
            for (const auto& entry : std::filesystem::directory_iterator(disk))
                if (!entry.path().string().ends_with("-shm")) // of the processes that have it open
                    std::filesystem::copy(entry.path(), path(), std::filesystem::copy_options::recursive);
        }
    } directory;
    std::shared_ptr<RecordingTransport> wire;
    CXDAVManager manager;
    const std::string base;
    NotificationCenter center, applicationCenter;
    LocalNotifications distributed;
    Preferences preferences{directory / "preferences.db", daemonMemory(directory / "contacts.db")};
    RunLoop loop;
    ClockAhead clock; // the engine's and the store's conduit's
    NoProgress progress;
    ThrowingEnd processEnd;
    FakeAccount account;
    IdleExit idleExit;
    AlwaysReachable network;
    Told alert;
    WithdrawnContactsFolder withdrawn{directory / "withdrawn"};
    WithdrawalNotice notice{withdrawn, Clock::system(), alert};
    std::unique_ptr<CXRolvane> application, database;
    std::unique_ptr<CXDSyncEngine> engine;

private:
    EngineConduits conduits(ConduitEngine& owner) {
        CXDVaultraConduit::Collaborators parts{manager, network,     preferences, clock,
                                               center,  distributed, alert,       *database};
        parts.withdrawals = &notice;
        auto vaultra = std::make_unique<CXDVaultraConduit>(owner, std::move(parts));
        auto cx = std::make_unique<CXDCXConduit>(
            owner, CXDCXConduit::Collaborators{*database, preferences, Clock::system(), center, /*processID*/ 1});
        CXDVaultraConduit* store = vaultra.get();
        return {std::move(cx), std::move(vaultra), [store] { return store->vaultraOffLine(); }};
    }
    std::function<void()> pendingEngine;
};

} // namespace rolvane::test
