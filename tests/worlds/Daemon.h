#pragma once

#include "Editor.h"
#include "Faults.h"
#include "conduits/UserAlert.h"
#include "conduits/WithdrawalNotice.h"
#include "engine/CXDSyncEngine.h"
#include "engine/EngineCollaborators.h"
#include "engine/IdleExit.h"
#include "foundation/Preferences.h"
#include "foundation/RunLoop.h"
#include "store/account/CXNetworkController.h"
#include "store/dav/CXDAVManager.h"

#include <memory>
#include <string>

namespace rolvane::worlds {

// One of the three people, or a computer of one, as far as processes need to know.
struct Person {
    char role = 'o';       // 'o' the owner, 's' the owner's second computer, 'w' the writer, 'r' the reader
    std::string directory; // database, preferences, state
    CXDAVAccount account;
    std::string password;
    Url tree; // the location that all is about: the owner's
    int threads = 3;

    std::string database() const { return directory + "/contacts.db"; }
    bool isOwner() const { return role == 'o' || role == 's'; }
    RemoteLocation location() const { return RemoteLocation(isOwner() ? "" : tree.absoluteString()); }
};

// The person's daemon in this process: what the program puts together, over the same files. Once a process.
class Daemon {
public:
    Daemon(const Person& person, const Weather& weather, Report& report);

    void pass();    // a full one; its exceptions are told
    void deliver(); // what other processes have saved
    bool nothingWaits();
    FaultyTransport& wire() { return *_wire; }
    CXRolvane& database() { return *_database; }

private:
    EngineConduits conduits(ConduitEngine& owner);
    void guarded(const std::function<void()>& work);

    struct Reachable : CXNetworkController {
        bool canReachAddress(const std::string&) override { return true; }
    };
    struct LaterClock : Clock {
        explicit LaterClock(double seconds) : later(seconds) {}
        Date now() const override { return system().now().addingSeconds(later); }
        const double later;
    };
    struct Quiet : UserAlert {
        void show(const Text&) override {}
        void tell(const Text&) override {}
    };
    struct NoProgress : ProgressReporter {
        void startedPhase(int32_t) override {}
        void willProcessChangeRecord(const CXDChangeRecordPtr&) override {}
        void didProcessChangeRecord(const CXDChangeRecordPtr&) override {}
        void stop() override {}
    };
    struct End : ProcessEnd {
        explicit End(Report& report) : told(report) {}
        [[noreturn]] void end(int status) override;
        Report& told;
    };
    struct Account : NetworkAccount {
        explicit Account(const Person& person) : user(person.account.user), threads(person.threads) {}
        std::optional<UserName> vaultraUser() const override { return user; }
        Value configValueForKey(const std::string& key, Value value) const override {
            return key == "CXDThreadCountKey" ? Value(static_cast<int64_t>(threads)) : value;
        }
        void updateConfigDataIfNeeded() override {}
        void setFailedPasswordHandler(std::function<void()>) override {}
        UserName user;
        int threads;
    };

    Report& _report;
    LaterClock _clock;
    std::shared_ptr<FaultyTransport> _wire;
    CXDAVManager _manager;
    NotificationCenter _center;
    LocalNotifications _distributed;
    Preferences _preferences;
    RunLoop& _loop = RunLoop::current();
    NoProgress _progress;
    End _end;
    Account _account;
    IdleExit _idleExit;
    Reachable _network;
    Quiet _alert;
    WithdrawnContactsFolder _withdrawn;
    WithdrawalNotice _notice{_withdrawn, Clock::system(), _alert};
    std::unique_ptr<CXRolvane> _database;
    std::unique_ptr<CXDSyncEngine> _engine;
    std::string _login;
};

std::shared_ptr<HttpTransport> signedIn(const Person& person);

} // namespace rolvane::worlds
