#include "EngineWorld.h"
#include "Writes.h"

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

namespace rolvane {
namespace {

namespace fs = std::filesystem;
using test::makeRecord;
using test::update;
using test::World;

// Ends the process, as a kill does, before the given write: of a database or preferences file, or to the store.
class KillBeforeWrite {
public:
    static constexpr int kKilled = 9;
    explicit KillBeforeWrite(int write) {
        left = write;
        test::interceptWrites([] {
            step();
            return true;
        });
    }
    static void step() {
        if (left-- == 0) ::_exit(kKilled);
    }

private:
    static std::atomic<int> left;
};
std::atomic<int> KillBeforeWrite::left = -1; // never

const std::vector<std::string> kPeople{"P1:CXPerson", "P2:CXPerson", "P3:CXPerson"};
constexpr const char* kGroup = "G1:CXGroup";

// A daemon whose contact source finds what is new since its last-sync date and compares its group with the prior state,
// and whose store is a folder: a file a person, one for the group's members, and a line in a log a write.
class Daemon {
public:
    explicit Daemon(const std::string& root) : world(true, root), store(root + "/store") {
        fs::create_directories(store);
        world.prepare = [this] { connect(); };
        world.start();
        deliveries = world.center.observe(kCXDatabaseChangedExternallyNotificationPriv, [this](const Notification& n) {
            CXDChangeRecords found;
            for (const Value& person : n.userInfo[kCXInsertedRecords].array())
                found.push_back(update(person.string().c_str()));
            world.engine->applyChangeRecords(found);
        });
    }
    void pass() { world.engine->bringSourcesUpToDate(); }

    std::set<std::string> people() const {
        std::set<std::string> names;
        for (const auto& entry : fs::directory_iterator(store)) {
            std::string name = entry.path().filename();
            if (name.ends_with(":CXPerson")) names.insert(name);
        }
        return names;
    }
    std::set<std::string> members() const { return linesOf("members"); }
    size_t writes() const {
        std::ifstream log(store + "/log");
        return static_cast<size_t>(std::count(std::istreambuf_iterator<char>(log), {}, '\n'));
    }
    std::vector<std::string> stateOf(const char* conduit) const {
        std::vector<std::string> names;
        for (const Value& v : memberState(conduit)) names.push_back(v.string());
        std::sort(names.begin(), names.end());
        return names;
    }

    World world;
    const std::string store;

    ObservationHandle deliveries;

private:
    std::set<std::string> linesOf(const std::string& file) const {
        std::set<std::string> lines;
        std::ifstream in(store + "/" + file);
        for (std::string line; std::getline(in, line);) lines.insert(line);
        return lines;
    }
    Array memberState(const char* conduit) const {
        return world.engine->conduitObjectForKey(conduit, "priorState")["<self>"]
            .dictionary()[kGroup]
            .dictionary()["memberUIDState"]
            .array();
    }
    void connect() {
        world.cx->whenGathering = [this] {
            CXDChangeRecords found;
            if (!world.stored("CXDCXConduitLastSyncDate"))
                for (const std::string& person : kPeople) found.push_back(update(person.c_str()));
            const Array known = memberState("CXDCX");
            for (const std::string& person : kPeople)
                if (!known.containsString(person))
                    found.push_back(makeRecord(CXDAddRecordToGroup, person.c_str(), kGroup));
            return found;
        };
        world.cx->whenClosing = [this] {
            world.preferences.set(kDaemonDomain, "CXDCXConduitLastSyncDate", world.clock.now());
            world.preferences.synchronize(kDaemonDomain);
        };
        world.vaultra->whenApplying = [this](const CXDChangeRecordPtr& record, bool*) {
            const std::lock_guard guard(lock);
            KillBeforeWrite::step();
            std::ofstream(store + "/log", std::ios::app) << record->type() << "\n";
            if (record->person()) std::ofstream(store + "/" + record->person()->str()) << "here";
            std::set<std::string> now = linesOf("members");
            for (const Value& v : record->inMemoryPayload().dictionary()["memberAdds"].array()) now.insert(v.string());
            std::ofstream out(store + "/members");
            for (const std::string& line : now) out << line << "\n";
            out.close();
            KillBeforeWrite::step();
            return true;
        };
    }
    std::mutex lock;
};

// Temporary directories lie in memory while it lives, where there is such a place: a kill loses nothing of a page
// cache, so what a disk adds is only waiting.
class InMemory {
public:
    InMemory() {
        if (const char* set = std::getenv("TMPDIR")) former = set;
        if (::access("/dev/shm", W_OK) == 0) ::setenv("TMPDIR", "/dev/shm", 1);
    }
    ~InMemory() {
        if (former)
            ::setenv("TMPDIR", former->c_str(), 1);
        else
            ::unsetenv("TMPDIR");
    }

private:
    std::optional<std::string> former;
};

class Crash : public ::testing::Test {
protected:
    InMemory memory; // first: the directory lies there
    test::TempDirectory before;
    // A daemon that has run before: its database and its preferences know each other, and one change is queued that
    // nobody could find again.
    void SetUp() override {
        Daemon daemon(before / "daemon");
        daemon.world.cx->whenGathering = nullptr;
        daemon.world.cx->whenClosing = nullptr;
        for (const char* person : {"P1:CXPerson", "P2:CXPerson", "P3:CXPerson", "P9:CXPerson"})
            daemon.world.rolvane->addRecord(CXPerson::initWithUniqueId(UniqueId(person)));
        const CXGroupRef group = CXGroup::initWithUniqueId(UniqueId(kGroup));
        daemon.world.rolvane->addRecord(group);
        for (const std::string& person : kPeople)
            group->addMember(
                std::dynamic_pointer_cast<CXPerson>(daemon.world.rolvane->recordForUniqueId(UniqueId(person))));
        daemon.world.rolvane->save();
        daemon.pass();
        daemon.world.engine->setPendingChanges({update("P9:CXPerson")});
        daemon.world.engine->setConduitObjectForKey("CXDLocal", Dictionary{{"never", "thrown away"}}, "marker");
        daemon.world.engine->syncPrefs();
        daemon.world.engine.reset();
        daemon.world.rolvane.reset();
    }
    std::string freshCopy(int number) {
        std::string root = before / ("copy" + std::to_string(number));
        fs::copy(before / "daemon", root, fs::copy_options::recursive);
        return root;
    }
    // True when the pass ended before it came to that write.
    bool killedBefore(int write, const std::string& root, void (*action)(Daemon&)) {
        const pid_t child = ::fork();
        if (child == 0) {
            Daemon daemon(root);
            const KillBeforeWrite kill(write);
            action(daemon);
            ::_exit(0);
        }
        int status = 0;
        ::waitpid(child, &status, 0);
        EXPECT_TRUE(WIFEXITED(status)) << "signal " << WTERMSIG(status);
        EXPECT_TRUE(WEXITSTATUS(status) == 0 || WEXITSTATUS(status) == KillBeforeWrite::kKilled) << WEXITSTATUS(status);
        return WEXITSTATUS(status) == 0;
    }
};

TEST_F(Crash, BeforeAnyWriteOfAPassLosesNothingAndDoublesNothing) {
    const std::set<std::string> everybody{"P1:CXPerson", "P2:CXPerson", "P3:CXPerson", "P9:CXPerson"};
    int write = 0;
    for (bool ended = false; !ended; ++write) {
        const std::string root = freshCopy(write);
        ended = killedBefore(write, root, [](Daemon& daemon) { daemon.pass(); });

        Daemon daemon(root);
        daemon.pass();
        SCOPED_TRACE("killed before write " + std::to_string(write));
        EXPECT_EQ(daemon.people(), everybody);
        EXPECT_EQ(daemon.members(), std::set<std::string>(kPeople.begin(), kPeople.end()));
        for (const char* conduit : {"CXDCX", "CXDVaultra"}) EXPECT_EQ(daemon.stateOf(conduit), kPeople) << conduit;
        EXPECT_TRUE(daemon.world.pending().empty());
        EXPECT_EQ(daemon.world.stored("CXDShareCount"), Value(daemon.world.rolvane->shareCount()));
        EXPECT_EQ(daemon.world.engine->conduitObjectForKey("CXDLocal", "marker"),
                  (Dictionary{{"never", "thrown away"}}))
            << "the memory was thrown away";
        const size_t writes = daemon.writes();
        daemon.pass();
        EXPECT_EQ(daemon.writes(), writes) << "one more pass has nothing to do";
        if (HasFailure()) break;
        fs::remove_all(root);
    }
    EXPECT_GT(write, 10) << "the pass has far more writes than were killed";
}

// As the contact conduit does: a record goes into the database, which is saved when the source is closed.
void takeIntoTheDatabase(Daemon& daemon) {
    World& world = daemon.world;
    world.cx->whenApplying = [&world](const CXDChangeRecordPtr& record, bool*) {
        world.rolvane->addRecord(CXPerson::initWithUniqueId(*record->person()));
        return true;
    };
    world.cx->whenClosing = [&world] { world.rolvane->save(); };
}

TEST_F(Crash, BeforeAnyWriteNoChangeHasLeftTheQueueThatTheContactDatabaseDoesNotHave) {
    const UniqueId person("P7:CXPerson");
    Daemon(before / "daemon")
        .world.engine->setPendingChanges(
            {makeRecord(CXDUpdateRecord, person.str().c_str(), nullptr, {4, 1, "<self>"})});
    int write = 0;
    for (bool ended = false; !ended; ++write) {
        const std::string root = freshCopy(write);
        ended = killedBefore(write, root, [](Daemon& daemon) {
            takeIntoTheDatabase(daemon);
            daemon.pass();
        });

        SCOPED_TRACE("killed before write " + std::to_string(write));
        Daemon daemon(root);
        const bool queued = !daemon.world.pending().empty();
        const bool saved = daemon.world.rolvane->recordForUniqueId(person) != nullptr;
        EXPECT_TRUE(queued || saved);
        EXPECT_TRUE(!ended || (saved && !queued));
        if (HasFailure()) break;
        fs::remove_all(root);
    }
    EXPECT_GT(write, 10);
}

TEST_F(Crash, BeforeAnyWriteOfADeliveryLosesNoOtherProcesssEdit) {
    {
        Daemon watching(before / "daemon");
        watching.world.engine->setPendingChanges({});
        watching.pass();
        watching.world.rolvane->cursorPosition(); // watched from here on
    }
    std::string saved;
    {
        World application(true, before / "daemon");
        const auto other = application.application();
        const auto person = CXPerson::create();
        other->addRecord(person);
        other->save();
        saved = person->uniqueId().str();
    }
    int write = 0;
    for (bool ended = false; !ended; ++write) {
        const std::string root = freshCopy(write);
        ended = killedBefore(write, root, [](Daemon& daemon) { daemon.world.rolvane->deliverExternalChanges(); });

        SCOPED_TRACE("killed before write " + std::to_string(write));
        Daemon daemon(root);
        daemon.pass();
        daemon.world.rolvane->deliverExternalChanges();
        EXPECT_TRUE(daemon.people().count(saved));
        EXPECT_TRUE(daemon.world.pending().empty());
        EXPECT_FALSE(daemon.world.rolvane->deliverExternalChanges());
        for (const char* conduit : {"CXDCX", "CXDVaultra"}) EXPECT_EQ(daemon.stateOf(conduit), kPeople) << conduit;
        if (HasFailure()) break;
        fs::remove_all(root);
    }
    EXPECT_GT(write, 10);
}

} // namespace
} // namespace rolvane
