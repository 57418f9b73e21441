#include "Daemon.h"
#include "contacts/database/DaemonMemory.h"

#include "conduits/database/CXDCXConduit.h"
#include "conduits/store/CXDVaultraConduit.h"
#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "model/PayloadKeys.h"
#include "store/locks/StoreLock.h"

#include <unistd.h>

namespace rolvane::worlds {

std::shared_ptr<HttpTransport> signedIn(const Person& person) {
    CurlTransportOptions options;
    options.caFile = person.account.caFile;
    auto transport = std::make_shared<CurlTransport>(options);
    transport->setCredentials(TransportCredentials{person.account.user.str(), person.password, person.account.origins(),
                                                   TransportCredentials::Scheme::basic});
    return transport;
}

void Daemon::End::end(int status) {
    told.line(lines::kWrong, "the daemon ended by itself");
    ::_exit(status);
}

Daemon::Daemon(const Person& person, const Weather& weather, Report& report)
    : _report(report), _clock(weather.later),
      _wire(std::make_shared<FaultyTransport>(signedIn(person), weather, report)),
      _manager(person.account, _wire, CXDAVManager::VersionsFile{person.directory + "/versions"}),
      _preferences(person.directory + "/preferences.db", daemonMemory(person.database())), _end(report),
      _account(person), _withdrawn(person.directory + "/withdrawn"), _login(person.account.user.str() + "login") {
    guarded([&] {
        _database = std::make_unique<CXRolvane>(CXRolvane::Options{
            .path = person.database(), .program = "RolvaneManager", .center = &_center, .runLoop = &_loop});
        _engine = std::make_unique<CXDSyncEngine>(EngineCollaborators{
            .rolvane = *_database,
            .preferences = _preferences,
            .distributed = _distributed,
            .runLoop = _loop,
            .clock = _clock,
            .progress = _progress,
            .processEnd = _end,
            .account = _account,
            .idleExit = _idleExit,
            .makeLock =
                [this](const Url& url) {
                    return std::make_shared<StoreLock>(_manager.impl(), url, LockLedger::user(), _clock);
                },
            .makeConduits = [this](ConduitEngine& owner) { return conduits(owner); },
            .loginName = _login,
            .renewalSleep = nullptr,
            .releaseLocksOfEndedRuns = [this] { releaseLocksOfEndedRuns(_manager); }});
    });
}

EngineConduits Daemon::conduits(ConduitEngine& owner) {
    CXDVaultraConduit::Collaborators parts{_manager, _network,     _preferences, _clock,
                                           _center,  _distributed, _alert,       *_database};
    parts.withdrawals = &_notice;
    auto vaultra = std::make_unique<CXDVaultraConduit>(owner, std::move(parts));
    auto cx = std::make_unique<CXDCXConduit>(
        owner, CXDCXConduit::Collaborators{*_database, _preferences, Clock::system(), _center});
    CXDVaultraConduit* store = vaultra.get();
    return {std::move(cx), std::move(vaultra), [store] { return store->vaultraOffLine(); }};
}

// An exception that leaves a pass ends the program; the next start goes on.
void Daemon::guarded(const std::function<void()>& work) {
    try {
        work();
    } catch (const CXException& exception) {
        CXLog("Ended by an exception: %@", exception);
        _report.line(lines::kThrew, exception.reason());
        ::_exit(0);
    }
}

void Daemon::pass() {
    guarded([&] { _engine->bringSourcesUpToDate(); });
}

void Daemon::deliver() {
    guarded([&] { _database->deliverExternalChanges(); });
}

bool Daemon::nothingWaits() {
    CXDSyncEngine& engine = *_engine; // what its store has refused rests, and is not among the changes that wait
    return engine.getPendingChanges().empty() && !_database->hasExternalChanges() &&
           engine.conduitObjectForKey(kConduitCX, kRefusedByStore).empty();
}

} // namespace rolvane::worlds
