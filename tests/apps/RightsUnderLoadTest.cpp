#include "LoadWriters.h"
#include "Neighbour.h"
#include "foundation/Paths.h"

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <random>
#include <sstream>

namespace rolvane::test {
namespace {

namespace fs = std::filesystem;

constexpr const char* kMoments = "begun-and-took";
constexpr double kMicro = 1e-6;

double now() {
    return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
}

// Edits one contact again and again on a thread of its own, as a person at the command line does, while it is let.
class Editor {
public:
    struct Edit {
        uint64_t began, ended;
        int status;
        std::string note;
    };
    Editor(Neighbour& person, std::string contact, Order& order)
        : _person(person), _contact(std::move(contact)), _order(order), _thread([this] { work(); }) {}
    ~Editor() {
        set(State::ending);
        _thread.join();
    }
    Editor(const Editor&) = delete;
    Editor& operator=(const Editor&) = delete;

    void begin() { set(State::working); }
    // No edit is under way when this returns.
    void pause() {
        std::unique_lock guard(_mutex);
        if (_state == State::working) _state = State::paused;
        _changed.wait(guard, [this] { return !_busy; });
    }
    // Until so many edits that began after the moment are saved or refused; false after half a minute.
    bool await(size_t count, uint64_t after) {
        std::unique_lock guard(_mutex);
        return _changed.wait_for(guard, std::chrono::seconds(30), [&] {
            return count <= static_cast<size_t>(std::count_if(_edits.begin(), _edits.end(),
                                                              [&](const Edit& edit) { return edit.began > after; }));
        });
    }
    std::vector<Edit> edits() const {
        const std::lock_guard guard(_mutex);
        return _edits;
    }

private:
    enum class State { paused, working, ending };
    void set(State state) {
        const std::lock_guard guard(_mutex);
        _state = state;
        _changed.notify_all();
    }
    bool mayWork() {
        std::unique_lock guard(_mutex);
        _busy = false;
        _changed.notify_all();
        _changed.wait(guard, [this] { return _state != State::paused; });
        return _busy = _state == State::working;
    }
    void work() {
        for (int i = 0; mayWork(); ++i) {
            Edit edit{_order.next(), 0, 0, "edit " + std::to_string(i)};
            edit.status = _person.rolvane({"edit", _contact, "--note", edit.note}).status;
            edit.ended = _order.next();
            const std::lock_guard guard(_mutex);
            _edits.push_back(edit);
        }
    }

    Neighbour& _person;
    const std::string _contact;
    Order& _order;
    mutable std::mutex _mutex; // guards the following
    std::condition_variable _changed;
    State _state = State::paused;
    bool _busy = false;
    std::vector<Edit> _edits;
    std::thread _thread; // the last member: it uses the others
};

// A time during which a right was certainly there, or certainly gone: from the acknowledgement of the list that said so
// until the owner began to change it again.
struct Span {
    bool mayWrite;
    uint64_t from, until;
    double fromTime, untilTime;
};

// A line of the store's own log.
struct Logged {
    double begun, seconds;
    std::string user, method, path;
    int status;
};

class RightsUnderLoad : public testing::Test {
protected:
    RightsUnderLoad() {
        const char* given = std::getenv("ROLVANE_TEST_SEED");
        seed = given ? static_cast<unsigned>(std::strtoul(given, nullptr, 10)) : std::random_device{}();
        random.seed(seed);
        RecordProperty("seed", static_cast<int>(seed));
        world.storeConfiguration = {"LogFormat \"%{sec}t %{usec_frac}t %D %u %m %>s %U\" " + std::string(kMoments),
                                    "CustomLog \"" + (world.home / "store/logs/moments.log") + "\" " + kMoments};
        world.bus();
        world.makeAccount();
        world.add("Ada");
        world.add("Bea");
        world.group("Family", {"Ada"});
        bob = std::make_unique<Neighbour>(world, "bob");
        world.done({"publish"});
    }

    int upTo(int most) { return std::uniform_int_distribution<int>(0, most)(random); }

    // Everything below the owner's tree with its bytes, but for the clock, which the owner's own passes set.
    std::map<std::string, std::string> tree() {
        std::map<std::string, std::string> files;
        for (const auto& entry : fs::recursive_directory_iterator(world.treeDirectory())) {
            const std::string name = entry.path().lexically_relative(world.treeDirectory()).string();
            if (name != "dateFile") files[name] = entry.is_regular_file() ? readFile(entry.path().string()) : "/";
        }
        return files;
    }

    std::vector<Logged> log() {
        std::ifstream file(world.home / "store/logs/moments.log");
        std::vector<Logged> all;
        double seconds = 0, fraction = 0, took = 0;
        for (Logged l; file >> seconds >> fraction >> took >> l.user >> l.method >> l.status >> l.path;) {
            l.begun = seconds + fraction * kMicro;
            l.seconds = took * kMicro;
            all.push_back(l);
        }
        return all;
    }

    // The same of everything that the store has seen, the daemon's own requests among it. A span begins with the end of
    // the owner's last ACL request of its command here.
    void judgeTheLog() {
        const std::vector<Logged> all = log();
        size_t daemons[2] = {0, 0};
        for (const Span& span : spans) {
            double from = 0;
            for (const Logged& l : all)
                if (l.user == "alice" && l.method == "ACL" && l.status == 200 && l.begun < span.fromTime)
                    from = std::max(from, l.begun + l.seconds);
            for (const Logged& l : all) {
                const bool writes = l.user == "bob" && l.path.starts_with("/dav/alice/") && l.method != "GET" &&
                                    l.method != "PROPFIND" && l.method != "REPORT" && l.method != "OPTIONS" &&
                                    l.method != "HEAD";
                if (!writes || l.begun <= from || l.begun + l.seconds >= span.untilTime) continue;
                EXPECT_EQ(l.status == 403, !span.mayWrite) << l.method << " " << l.path << ": " << l.status;
                if (l.path.find("/load-") == std::string::npos) ++daemons[span.mayWrite];
            }
        }
        EXPECT_GT(daemons[true], 0U);
        EXPECT_GT(daemons[false], 0U) << "the daemon tried nothing that was refused";
    }

    // The owner's command; from when its list is acknowledged the span holds.
    void change(const std::vector<std::string>& command, bool mayWrite) {
        if (!spans.empty()) {
            spans.back().until = order.next();
            spans.back().untilTime = now();
        }
        world.done(command);
        spans.push_back({mayWrite, order.next(), UINT64_MAX, now(), 1e12});
    }

    std::string ownersNote() { return world.json({"show", "Ada"}).at("properties").value("Note", ""); }

    Order order;
    unsigned seed = 0;
    std::mt19937 random;
    CommandWorld world;
    std::unique_ptr<Neighbour> bob;
    std::vector<Span> spans;
};

TEST_F(RightsUnderLoad, NothingIsWrittenAfterAWithdrawalIsAcknowledgedAndNothingIsStuck) {
    SCOPED_TRACE("ROLVANE_TEST_SEED=" + std::to_string(seed));
    std::printf("seed %u\n", seed);
    Editor editor(*bob, "Ada", order);
    LoadWriters writers({.collection = world.store().baseURL() + "/alice/Contacts/People/3/",
                         .caFile = world.store().caFile(),
                         .user = "bob",
                         .password = UserWorld::kPassword},
                        order);
    std::vector<bool> withdrawals{false, true, upTo(1) == 1};
    std::shuffle(withdrawals.begin(), withdrawals.end(), random);
    bool subscribed = false;
    size_t withdrawn = 0, refused = 0;
    for (const bool withdraw : withdrawals) {
        // What is granted works, and what was refused before is forgotten.
        change({"share", "bob", "--write"}, true);
        bob->done(subscribed ? std::vector<std::string>{"sync"} : std::vector<std::string>{"subscribe", "alice"});
        subscribed = true;
        EXPECT_EQ(bob->json({"subscriptions"})[0]["writable"], true);
        const std::string granted = "granted " + std::to_string(spans.size());
        bob->done({"edit", "Ada", "--note", granted});
        bob->done({"sync"});
        world.done({"sync"});
        EXPECT_EQ(ownersNote(), granted);
        ASSERT_TRUE(writers.awaitEach(3, order.next()));

        // At any moment of somebody's work the owner thinks better of it.
        editor.begin();
        const uint64_t working = order.next();
        ASSERT_TRUE(editor.await(static_cast<size_t>(upTo(2)), working));
        ASSERT_TRUE(writers.awaitEach(static_cast<size_t>(upTo(40)), working));
        if (withdraw)
            change({"unshare", "bob"}, false);
        else
            change({"share", "bob"}, false);
        const auto left = tree();
        const uint64_t acknowledged = spans.back().from;
        ASSERT_TRUE(writers.awaitEach(20, acknowledged));
        ASSERT_TRUE(editor.await(2, acknowledged));
        editor.pause();

        // The next passes of both sides find everything settled.
        bob->done({"sync"});
        const auto status = bob->json({"status"});
        EXPECT_EQ(status["pending"], 0);
        const auto edits = editor.edits();
        const bool tooLate = std::any_of(edits.begin(), edits.end(), [&](const Editor::Edit& edit) {
            return edit.began > acknowledged && edit.status == kDone;
        });
        if (tooLate) {
            EXPECT_GT(status["refused"].size(), refused) << status.dump(2);
        }
        refused = status["refused"].size();
        for (const auto& each : status["refused"]) EXPECT_EQ(each["user"], "alice");
        if (withdraw) {
            EXPECT_TRUE(status["subscriptions"].empty());
            ASSERT_EQ(status["withdrawn"].size(), ++withdrawn) << status.dump(2);
            EXPECT_EQ(status["withdrawn"].back()["people"], 2);
            EXPECT_TRUE(bob->json({"list"}).empty()) << "the copies have left";
            subscribed = false;
        } else {
            EXPECT_EQ(status["subscriptions"][0]["writable"], false);
        }
        EXPECT_EQ(tree(), left);
        world.done({"sync"});
        EXPECT_EQ(world.json({"status"})["pending"], 0);
        const std::string kept = ownersNote();
        if (!withdraw) {
            EXPECT_EQ(bob->json({"show", "Ada"}).at("properties").value("Note", ""), kept) << "the publisher's again";
        }
        EXPECT_TRUE(std::none_of(edits.begin(), edits.end(), [&](const Editor::Edit& edit) {
            return edit.began > acknowledged && edit.note == kept;
        }));
    }
    EXPECT_GT(refused, 0U) << "no edit was too late";
    spans.back().until = order.next();
    spans.back().untilTime = now();

    size_t judged = 0;
    for (const LoadWriters::Request& request : writers.requests())
        for (const Span& span : spans) {
            if (request.began < span.from || request.ended > span.until) continue;
            EXPECT_EQ(request.status == 403, !span.mayWrite) << request.method << ": " << request.status;
            ++judged;
        }
    EXPECT_GT(judged, 100U);
    judgeTheLog();
}

} // namespace
} // namespace rolvane::test
