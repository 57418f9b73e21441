#include "MeetingRows.h"

#include "contacts/records/Constants.h"
#include "foundation/PropertyList.h"

#include <mutex>

namespace rolvane::board {

namespace {

using test::FakeAnswer;
using test::FakeRequest;

constexpr size_t kRounds = 4; // of each scenario, for what people do after the pass
constexpr size_t kMostWrites = 200;
constexpr int kFound = 200;

std::string bodyOf(const FakeAnswer& answer) {
    const std::string& bytes = answer.pieces.front().bytes;
    const size_t end = bytes.find("\r\n\r\n");
    return end == std::string::npos ? "" : bytes.substr(end + 4);
}
bool isStatus(const FakeAnswer& answer, int status) {
    return !answer.pieces.empty() &&
           answer.pieces.front().bytes.starts_with("HTTP/1.1 " + std::to_string(status) + " ");
}

// Lets somebody else write the same contact before one write of the pass reaches the store.
class Crossing {
public:
    Crossing(test::FaultyStore& store, size_t number, std::string mark)
        : _store(store), _number(number), _mark(std::move(mark)) {
        _store.set([this](const FakeRequest& request) -> std::optional<FakeAnswer> {
            if (request.method == "PUT" && request.target.ends_with(kEnd) && isTheOne()) cross(request);
            return std::nullopt;
        });
    }
    ~Crossing() { _store.set(nullptr); }
    Crossing(const Crossing&) = delete;
    Crossing& operator=(const Crossing&) = delete;

    const std::optional<worlds::Deed>& deed() const { return _deed; } // when the pass has ended

private:
    static constexpr std::string_view kEnd = "CXPerson", kEncodedColon = "%3A";

    bool isTheOne() {
        const std::lock_guard guard(_lock);
        return _count++ == _number;
    }
    void cross(const FakeRequest& theirs) {
        FakeRequest mine = theirs;
        for (const char* condition : {"if-match", "if-none-match", "if"}) mine.headers.erase(condition);
        FakeRequest look = mine;
        look.method = "GET";
        look.body.clear();
        look.headers.erase("content-type");
        const FakeAnswer there = _store.handOn(look);
        const bool isThere = isStatus(there, kFound);
        Dictionary content = PropertyList::fromXML(isThere ? bodyOf(there) : theirs.body).dictionary().mutableCopy();
        const Value before = content[kCXNicknameProperty];
        content.set(kCXNicknameProperty, _mark);
        mine.body = PropertyList::toXML(content);
        const FakeAnswer done = _store.handOn(mine);
        if (!isStatus(done, 201) && !isStatus(done, 204)) return;
        std::string thing = theirs.target.substr(theirs.target.rfind('/') + 1);
        if (const size_t colon = thing.find(kEncodedColon); colon != std::string::npos)
            thing.replace(colon, kEncodedColon.size(), ":");
        const std::lock_guard guard(_lock);
        _deed = worlds::Deed{
            worlds::Deed::Kind::set, '?', thing, kCXNicknameProperty, before.isString() ? before.string() : "", _mark};
    }

    test::FaultyStore& _store;
    const size_t _number;
    const std::string _mark;
    std::mutex _lock; // guards the following
    size_t _count = 0;
    std::optional<worlds::Deed> _deed;
};

} // namespace

bool calmOnce(Work& work, size_t number) {
    if (number >= kRounds * scenarios().size()) return false;
    const Scenario& scenario = scenarios()[number % scenarios().size()];
    work.stage.forgetStory();
    work.stage.bringBack(scenario.name);
    const Ending ending = work.stage.pass(scenario.role);
    goOn(work, scenario, number);
    judge(work, scenario.name + ", calm, number " + std::to_string(number), settlingOf(scenario), ending);
    return true;
}

void calm(Work& work) {
    for (size_t number = 0; number < kRounds * scenarios().size(); ++number) {
        if (!work.isMine(number)) continue;
        if (work.timeIsOver()) return;
        calmOnce(work, number);
    }
}

namespace {

// More to write, new contacts among it.
worlds::Habits writing() {
    worlds::Habits habits;
    habits.text = habits.make = 30;
    habits.remove = habits.removeGroup = habits.phone = 0;
    habits.most = 10;
    return habits;
}

} // namespace

bool meetOnce(Work& work, const Scenario& scenario, size_t write, bool newOnes) {
    constexpr size_t kNewOnes = 5;
    if (scenario.alone || scenario.role == 'r') return false;
    Stage& stage = work.stage;
    stage.forgetStory();
    stage.bringBack(scenario.name);
    if (newOnes)
        stage.edit(
            scenario.role, [](worlds::Editor& editor) { editor.makePeople(kNewOnes); }, "m");
    else
        stage.edit(scenario.role, writing(), "m");
    Ending ending;
    std::optional<worlds::Deed> deed;
    {
        const Crossing crossing(stage.entrance(), write,
                                "x" + std::to_string(stage.seed()) + "." + std::to_string(write));
        ending = stage.pass(scenario.role);
        deed = crossing.deed();
    }
    if (!deed) return false;
    deed->who = scenario.role == 'o' ? 'w' : 'o';
    stage.model().take(*deed);
    stage.tell("   MEETS " + deed->thing + ", written meanwhile: " + deed->before + " -> " + deed->after);
    goOn(work, scenario, write);
    judge(work, scenario.name + " met at its write " + std::to_string(write), settlingOf(scenario), ending);
    return true;
}

void meet(Work& work) {
    for (const Scenario& scenario : scenarios())
        for (size_t write = 0; write < kMostWrites; ++write) {
            if (!work.isMine(write)) continue;
            if (work.timeIsOver()) return;
            if (!meetOnce(work, scenario, write)) break;
        }
}

} // namespace rolvane::board
