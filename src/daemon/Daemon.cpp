#include "daemon/Daemon.h"

#include "daemon/DaemonOptions.h"

#include "conduits/LocalizedText.h"
#include "conduits/WithdrawalNotice.h"
#include "conduits/database/CXDCXConduit.h"
#include "conduits/store/CXDVaultraConduit.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/database/CXUserDefaults.h"
#include "contacts/database/DaemonMemory.h"
#include "contacts/database/DamagedDatabase.h"
#include "contacts/records/CXAllGroup.h"
#include "daemon/BootTimer.h"
#include "daemon/BusPresence.h"
#include "daemon/CXDProgressManager.h"
#include "daemon/CheckIn.h"
#include "daemon/DesktopAlert.h"
#include "daemon/InstanceLock.h"
#include "daemon/Leftovers.h"
#include "daemon/NewsWatch.h"
#include "daemon/OwnPasses.h"
#include "daemon/PassCounters.h"
#include "daemon/StoreNewsRequest.h"
#include "daemon/TerminationWatch.h"
#include "daemon/TreesAhead.h"
#include "daemon/Watchdog.h"
#include "engine/CXDSyncEngine.h"
#include "engine/pass/OutcomeKeeper.h"
#include "engine/pass/StoreFailures.h"
#include "foundation/BootTime.h"
#include "foundation/BusConnection.h"
#include "foundation/DaemonNotifications.h"
#include "foundation/FreeMemory.h"
#include "foundation/Log.h"
#include "foundation/Paths.h"
#include "foundation/SignOfLife.h"
#include "store/account/CXNetworkController.h"
#include "store/dav/CXDAVManager.h"

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <optional>
#include <random>
#include <string_view>
#include <sys/eventfd.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

namespace rolvane {

namespace {

// What the watch's thread may touch while the main thread is at work.
struct Termination {
    int event = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK); // readable: the loop is to end the process
    std::atomic<bool> asked = false;
    std::atomic<CXDSyncEngine*> engine = nullptr;
    std::atomic<CXDAVManager*> store = nullptr;

    void ask() {
        asked = true;
        if (CXDSyncEngine* running = engine.load()) running->requestTermination();
        if (CXDAVManager* client = store.load()) client->abortAll();
        const uint64_t one = 1;
        [[maybe_unused]] const ssize_t n = ::write(event, &one, sizeof one);
    }
};

Termination& termination() {
    static Termination state;
    return state;
}

// Everything that counts is durable at any moment, so the process ends at once, whatever its other threads do.
class UnixProcessEnd : public ProcessEnd {
public:
    explicit UnixProcessEnd(const DaemonChannel& channel) : _channel(channel) {}
    [[noreturn]] void end(int status) override {
        _channel.removeFile();
        sd_notify(0, "STOPPING=1");
        if (const CXDAVManager* client = termination().store) client->processEnds();
        std::fflush(nullptr);
        ::_exit(status);
    }

private:
    const DaemonChannel& _channel;
};

// The process's collaborators, made in the order in which they need each other; they live until the process ends.
class Daemon {
public:
    Daemon() : _loop(RunLoop::current()), _channel(_loop), _progress(_channel), _processEnd(_channel) {
        _terminated = _loop.addPort(termination().event, [this](uint32_t) { terminate(); });
    }

    void readDebugLevel() {
        setDebugLevel(static_cast<int>(Preferences::shared().get(kDaemonDomain, "CXDDebugLevel").integer()));
    }

    void parseArguments(int argc, char** argv) {
        for (int i = 1; i < argc; ++i)
            if (std::strcmp(argv[i], kEndWhenIdle.name) == 0) IdleExit::process().setInterval(0);
    }

    // From here on this process serves its user: on the control socket, and under its name on the bus.
    void listen(const std::string& path) {
        _channel.listen(path);
        if (const auto address = sessionBusAddress()) _presence.emplace(*address);
    }

    void feedWatchdog() {
        const auto limit = Watchdog::limitOfTheManager();
        if (!limit) return;
        _watchdog = std::make_shared<Watchdog>(_loop, *limit, Watchdog::platform());
        setSignOfLifeListener([watchdog = _watchdog] { watchdog->sign(); });
    }

    void openDatabase() {
        CXRolvane::Options options;
        options.program = "RolvaneManager";
        options.distributed = &_channel;
        options.runLoop = &_loop;
        requireKnownDatabase(options.path, Preferences::shared());
        Preferences::shared().keepElsewhere(daemonMemory());
        CXRolvane::configureShared(options);
        CXRolvane::sharedRolvane();
        CXDSyncEngine::setMaker([this] { return makeEngine(); });
    }

    bool publishes() const {
        const auto locations = CXAllGroup::allGroup()->multiValueForProperty(kCXRemoteLocationProperty);
        return locations && locations->count() != 0;
    }

    bool subscribes() const {
        for (const CXSubscriptionRef& subscription : CXRolvane::sharedRolvane().subscriptions())
            if (subscription->remoteLocation() != RemoteLocation("local")) return true;
        return false;
    }

    void firstPass() {
        CXDLog("Sharing synchronization update started.");
        CXDSyncEngine& engine = CXDSyncEngine::sharedSyncEngine();
        _channel.serve(); // the engine observes
        engine.bringSourcesUpToDate();
        CXDLog("Sharing synchronization update completed.");
    }

    void serve() {
        _channel.serve();
        _loop.runUntil(Date::distantFuture());
    }

private:
    std::unique_ptr<CXDSyncEngine> makeEngine() {
        CXDAVManager& store = storeOfTheAccount();
        termination().store = &store;
        makeOwnPasses(store);
        _account = makeStoreNetworkAccount();
        auto engine = std::make_unique<CXDSyncEngine>(EngineCollaborators{
            CXRolvane::sharedLocalRolvane(), Preferences::shared(), _channel, _loop, Clock::system(), _progress,
            _processEnd, *_account, IdleExit::process(), [](const Url& url) { return CXWebDAVLock::initWithURL(url); },
            [this, &store](ConduitEngine& owner) { return makeConduits(owner, store); }, loginUserName(), nullptr,
            [&store] { releaseLocksOfEndedRuns(store); }, [&store] { return takeFailures(store); },
            [this, &store](const PassOutcome& outcome) {
                _basesRead = basesOf(outcome, store.account());
                _counters.passEnded(outcome);
                if (_ownPasses) _ownPasses->passEnded(resultOf(outcome));
                if (_news) _news->passEnded(resultOf(outcome), treesOf(outcome));
            }});
        _progress.setEngine(engine.get(), engine.get());
        termination().engine = engine.get();
        if (termination().asked) termination().ask(); // it came while the engine was being made
        return engine;
    }

    // The network's changes go to the network store's conduit: at once where the process ends when it is idle, else
    // when the passes of the daemon's own have their turn.
    void makeOwnPasses(CXDAVManager& store) {
        CXNetworkController& network = CXNetworkController::sharedNetworkController();
        if (IdleExit::process().interval() != IdleExit::kNever)
            return network.startMonitoring(_loop, NotificationCenter::defaultCenter());
        _timer.emplace(_loop, [this] { _ownPasses->wake(); });
        _sleep.emplace(_loop, [this] { networkChanged(); });
        OwnPasses::Collaborators with;
        with.now = secondsSinceBoot;
        with.wakeAt = [this](std::optional<double> at) { _timer->set(at); };
        with.lookInterval = [this] {
            return _news && _news->isLive() ? OwnPasses::lookIntervalWithNews(lookInterval()) : lookInterval();
        };
        with.askStore = [&store] { return askStore(store); };
        _treesAhead.emplace(_loop, store);
        with.prepare = [this](std::function<void()> done) { return _treesAhead->begin(_basesRead, std::move(done)); };
        with.pass = [] { ownPass(); };
        with.networkIsBack = [this] {
            NotificationCenter::defaultCenter().post({kCXNetworkConfigurationDidChangeNotification, std::nullopt, {}});
            return OwnPasses::Answer{!_vaultra->vaultraOffLine(), 0};
        };
        _ownPasses.emplace(std::move(with));
        _networkChanged = _networkNews.observe(kCXNetworkConfigurationDidChangeNotification,
                                               [this](const Notification&) { networkChanged(); });
        makeNewsWatch(store);
        network.startMonitoring(_loop, _networkNews);
    }

    void makeNewsWatch(CXDAVManager& store) {
        _newsTimer.emplace(_loop, [this] { _news->wake(); });
        NewsWatch::Collaborators with;
        with.now = secondsSinceBoot;
        with.wakeAt = [this](std::optional<double> at) { _newsTimer->set(at); };
        with.random = [this] { return std::uniform_real_distribution<double>(0, 1)(_random); };
        with.isWanted = [] { return wantsNews(); };
        with.open = [this, &store](const std::vector<Url>& trees, const std::string& position,
                                   NewsWatch::Listener listener) {
            return StoreNewsRequest::open(_loop, store, trees, position, std::move(listener));
        };
        with.news = [this](double spread) { _ownPasses->newsCame(spread); };
        with.livelinessChanged = [this] { _ownPasses->lookIntervalChanged(); };
        _news.emplace(std::move(with));
    }

    // Who never looks for other people's news by itself does not want to hear of them either. With the variable every
    // pass has a cause that is known beforehand, as tests of everything else need it.
    static bool wantsNews() {
        const char* wish = std::getenv("ROLVANE_NEWS");
        return lookInterval() > 0 && (!wish || std::string_view(wish) != "never");
    }

    void networkChanged() {
        _ownPasses->networkChanged();
        _news->networkChanged();
    }

    static std::vector<Url> treesOf(const PassOutcome& outcome) {
        std::vector<Url> trees;
        for (const PassTree& tree : outcome.trees)
            if (!tree.ended) trees.emplace_back(tree.location);
        return trees;
    }

    // As the passes name them.
    static std::vector<Url> basesOf(const PassOutcome& outcome, const CXDAVAccount& account) {
        std::vector<Url> bases;
        for (const PassTree& tree : outcome.trees)
            if (!tree.ended) bases.push_back(account.baseLocationFor(tree.user == kSelf ? account.user : tree.user));
        return bases;
    }

    static double lookInterval() {
        try {
            const Value set = Preferences::shared().get(kDaemonDomain, OwnPasses::kLookIntervalKey);
            return OwnPasses::lookIntervalOf(set.isAbsent() ? std::nullopt : std::optional(set.real()));
        } catch (const CXException&) { // the passes tell of preferences that cannot be read
            return OwnPasses::kLookInterval;
        }
    }

    // A disk that is full now may have room at the next attempt.
    static void ownPass() {
        try {
            CXDSyncEngine::sharedSyncEngine().bringSourcesUpToDate();
        } catch (const CXException& exception) {
            CXLog("A pass has failed, and is made again later: %@", exception);
        }
    }

    // A refused password is the next pass's to tell. What failed here is no failure of that pass.
    static OwnPasses::Answer askStore(CXDAVManager& store) {
        const std::vector<std::string> origins = store.account().origins();
        const std::string host = origins.empty() ? "" : Url(origins.front() + "/").host();
        if (!CXNetworkController::sharedNetworkController().canReachAddress(host)) return {};
        CXDAVError error;
        const bool there = store.canReach(error) || error.code == kCXDAVErrorAuthentication;
        OwnPasses::Answer answer{there, 0};
        for (const PassFailure& failure : takeFailures(store))
            answer.retryAfter = std::max(answer.retryAfter, failure.retryAfterSeconds.value_or(0));
        return answer;
    }

    // An account that is there and cannot be used is not the same as none: without one, publication and subscriptions
    // leave the database.
    static CXDAVManager& storeOfTheAccount() {
        const auto saved = CXDAVAccount::load(); // throws for one that cannot be used
        CXDAVManager& store = CXDAVManager::defaultManager();
        if (saved && store.account().user.empty())
            throw CXException(kCXNetworkException, "The account in " + CXDAVAccount::defaultPath() +
                                                       " could be read once, but not again. Start once more.");
        return store;
    }

    EngineConduits makeConduits(ConduitEngine& engine, CXDAVManager& store) {
        auto vaultra = std::make_unique<CXDVaultraConduit>(
            engine, CXDVaultraConduit::Collaborators{store,
                                                     CXNetworkController::sharedNetworkController(),
                                                     Preferences::shared(),
                                                     Clock::system(),
                                                     NotificationCenter::defaultCenter(),
                                                     _channel,
                                                     _alert,
                                                     CXRolvane::sharedLocalRolvane(),
                                                     {},
                                                     &_withdrawals});
        auto cx = std::make_unique<CXDCXConduit>(
            engine, CXDCXConduit::Collaborators{CXRolvane::sharedLocalRolvane(), Preferences::shared(), Clock::system(),
                                                NotificationCenter::defaultCenter()});
        _vaultra = vaultra.get();
        return {std::move(cx), std::move(vaultra), [this] { return _vaultra->vaultraOffLine(); }};
    }

    void terminate() {
        if (CXDSyncEngine* engine = CXDSyncEngine::sharedSyncEngineIfMade()) engine->killCXD();
        _processEnd.end(0);
    }

    RunLoop& _loop;
    DaemonChannel _channel;
    CXDProgressManager _progress;
    UnixProcessEnd _processEnd;
    DesktopAlert _alert;
    WithdrawnContactsFolder _withdrawn;
    WithdrawalNotice _withdrawals{_withdrawn, Clock::system(), _alert};
    std::unique_ptr<NetworkAccount> _account;
    CXDVaultraConduit* _vaultra = nullptr; // the engine's
    NotificationCenter _networkNews;
    ObservationHandle _networkChanged;
    std::optional<OwnPasses> _ownPasses; // none in a process that ends when it is idle
    std::optional<BootTimer> _timer, _newsTimer;
    std::optional<NewsWatch> _news;        // as _ownPasses
    std::optional<TreesAhead> _treesAhead; // as _ownPasses
    std::vector<Url> _basesRead;           // of the trees that the last pass was about
    PassCounters _counters{PassCounters::defaultPath(), Clock::system().now()};
    std::mt19937 _random{std::random_device()()};
    std::optional<SleepWatch> _sleep;
    RunLoop::Handle _terminated;
    std::optional<BusPresence> _presence; // none without a session bus
    std::shared_ptr<Watchdog> _watchdog;  // none where nobody watches
};

// Beside the installed program, or where the build has made them.
std::string catalogsOfAlerts() {
    std::error_code error;
    const auto program = std::filesystem::read_symlink("/proc/self/exe", error).parent_path().parent_path();
    const auto installed = program / "share/locale";
    return std::filesystem::exists(installed / "de/LC_MESSAGES/CXStrings.mo", error) ? installed
                                                                                     : program.parent_path() / "po";
}

} // namespace

int runDaemon(int argc, char** argv) {
    constexpr double kTerminationGrace = 4.5; // seconds; the promise is five
    shareHeaps();
    useCatalogsIn(catalogsOfAlerts());
    const TerminationWatch watch([] { termination().ask(); }, kTerminationGrace);
    std::optional<InstanceLock> lock; // outlives the daemon, whose socket lies where the next one's will
    try {
        Daemon daemon;
        daemon.feedWatchdog();
        daemon.readDebugLevel();
        CXDLog("Parsing arguments.");
        daemon.parseArguments(argc, argv);

        const std::string lockPath = InstanceLock::defaultPath();
        const std::string controlPath = controlSocketPath();
        if (auto taken = InstanceLock::acquire(lockPath, controlPath)) lock.emplace(std::move(*taken));
        if (!lock) {
            CXLog("RolvaneManager is already running (process %d) and serves this user; this one ends.",
                  InstanceLock::holder(lockPath).value_or(0));
            return 0;
        }
        daemon.listen(controlPath); // the lock's holder alone does
        removeLeftovers();
        CXDLog("Checking in with kickerd.");
        const CheckInPorts ports = CXDCheckIn(RunLoop::current());

        daemon.openDatabase();
        const bool shares = daemon.publishes() || daemon.subscribes();
        sd_notify(0, "READY=1"); // its files can be used; the first pass may take long
        if (shares) daemon.firstPass();
        CXDSyncEngine::persist();
        CXDLog("Entering main run loop.");
        daemon.serve();
    } catch (const CXException& exception) {
        CXLog("Quitting due to an unhandled exception: %@", exception);
        OutcomeKeeper::endWithoutAPass(Preferences::shared(), Clock::system(), exception.reason()); // throws nothing
    }
    return 0;
}

} // namespace rolvane
