#include "engine/pass/PassOutcome.h"

#include "foundation/BootTime.h"
#include "foundation/Preferences.h"

#include <algorithm>

namespace rolvane {

namespace {

void setIf(Dictionary& to, const char* key, bool value) {
    if (value) to.set(key, true);
}
void setIf(Dictionary& to, const char* key, int64_t value) {
    if (value != 0) to.set(key, value);
}
void setIf(Dictionary& to, const char* key, const std::string& value) {
    if (!value.empty()) to.set(key, value);
}
template <class T>
void setIf(Dictionary& to, const char* key, const std::optional<T>& value) {
    if (value) to.set(key, *value);
}

std::optional<double> number(const Value& value) {
    return value.isNumber() ? std::optional(value.real()) : std::nullopt;
}

Value encoded(const PassFailure& failure) {
    Dictionary all;
    setIf(all, "method", failure.method);
    setIf(all, "url", failure.url);
    setIf(all, "status", static_cast<int64_t>(failure.status));
    setIf(all, "error", static_cast<int64_t>(failure.error));
    setIf(all, "words", failure.words);
    setIf(all, "retryAfter", failure.retryAfterSeconds);
    return all;
}

std::optional<PassFailure> decodedFailure(const Value& value) {
    const Dictionary* all = value.dictionaryIf();
    if (!all) return std::nullopt;
    return PassFailure{(*all)["method"].string(),
                       (*all)["url"].string(),
                       static_cast<int>((*all)["status"].integer()),
                       static_cast<int>((*all)["error"].integer()),
                       (*all)["words"].string(),
                       number((*all)["retryAfter"])};
}

void setIf(Dictionary& to, const char* key, const std::optional<PassFailure>& value) {
    if (value) to.set(key, encoded(*value));
}

Dictionary encoded(const PassDirection& direction) {
    Dictionary all;
    setIf(all, "asked", direction.asked);
    setIf(all, "reached", direction.reached);
    setIf(all, "carried", direction.carried);
    setIf(all, "waiting", direction.waiting);
    setIf(all, "refused", direction.refused);
    setIf(all, "inStep", direction.inStep);
    setIf(all, "waitingSince", direction.waitingSince);
    setIf(all, "why", direction.why);
    return all;
}

PassDirection decodedDirection(const Dictionary& all) {
    PassDirection direction;
    direction.asked = all["asked"].boolean();
    direction.reached = all["reached"].boolean();
    direction.carried = all["carried"].integer();
    direction.waiting = all["waiting"].integer();
    direction.refused = all["refused"].integer();
    direction.inStep = all["inStep"].date();
    direction.waitingSince = all["waitingSince"].date();
    direction.why = decodedFailure(all["why"]);
    return direction;
}

Value encoded(const PassTree& tree) {
    Dictionary all{{"user", tree.user}, {"location", tree.location}};
    setIf(all, "ended", tree.ended);
    setIf(all, "leftAlone", tree.leftAlone);
    setIf(all, "listsWait", tree.listsWait);
    all.set("out", encoded(tree.out));
    all.set("in", encoded(tree.in));
    return all;
}

PassTree decodedTree(const Dictionary& all) {
    PassTree tree;
    tree.user = UserName(all["user"].string());
    tree.location = all["location"].string();
    tree.ended = all["ended"].boolean();
    tree.leftAlone = all["leftAlone"].boolean();
    tree.listsWait = all["listsWait"].boolean();
    tree.out = decodedDirection(all["out"].dictionary());
    tree.in = decodedDirection(all["in"].dictionary());
    return tree;
}

bool isSent(const PassTree& tree) {
    return tree.out.waiting == 0 && tree.out.refused == 0 && !tree.listsWait;
}

bool isRead(const PassTree& tree) {
    return tree.in.reached && tree.in.waiting == 0 && !tree.ended && !tree.leftAlone;
}

} // namespace

const PassTree* PassOutcome::tree(const UserName& user) const {
    const auto found =
        std::find_if(trees.begin(), trees.end(), [&](const PassTree& each) { return each.user == user; });
    return found == trees.end() ? nullptr : &*found;
}

Value encodeOutcome(const PassOutcome& outcome) {
    Dictionary all{{"number", outcome.number},
                   {"began", outcome.began},
                   {"ended", outcome.ended},
                   {"beganSinceBoot", outcome.beganSinceBoot}};
    setIf(all, "full", outcome.full);
    setIf(all, "storeReached", outcome.storeReached);
    setIf(all, "anotherFollows", outcome.anotherFollows);
    setIf(all, "storeFailure", outcome.storeFailure);
    setIf(all, "exception", outcome.exception);
    setIf(all, "storage", outcome.storage);
    Array trees;
    for (const PassTree& tree : outcome.trees) trees.append(encoded(tree));
    all.set("trees", trees);
    return all;
}

std::optional<PassOutcome> decodeOutcome(const Value& value) {
    const Dictionary* stored = value.dictionaryIf();
    if (!stored || !(*stored)["ended"].isDate()) return std::nullopt;
    const Dictionary& all = *stored;
    PassOutcome outcome;
    outcome.number = all["number"].integer();
    outcome.began = all["began"].date().value_or(Date());
    outcome.ended = *all["ended"].date();
    outcome.beganSinceBoot = all["beganSinceBoot"].real();
    outcome.full = all["full"].boolean();
    outcome.storeReached = all["storeReached"].boolean();
    outcome.anotherFollows = all["anotherFollows"].boolean();
    outcome.storeFailure = decodedFailure(all["storeFailure"]);
    outcome.exception = all["exception"].optionalString();
    outcome.storage = all["storage"].optionalString();
    for (const Value& tree : all["trees"].array()) outcome.trees.push_back(decodedTree(tree.dictionary()));
    return outcome;
}

std::optional<PassOutcome> lastOutcome(const Preferences& preferences) {
    return decodeOutcome(preferences.get(kDaemonDomain, kCXDPassOutcome));
}

bool isComplete(const PassOutcome& outcome) {
    return !outcome.exception && !outcome.storage;
}

bool everythingIsSent(const PassOutcome& outcome) {
    return isComplete(outcome) && std::all_of(outcome.trees.begin(), outcome.trees.end(), isSent);
}

bool everythingIsUpToDate(const PassOutcome& outcome) {
    return outcome.full && outcome.storeReached && !outcome.anotherFollows && everythingIsSent(outcome) &&
           std::all_of(outcome.trees.begin(), outcome.trees.end(), isRead);
}

std::optional<PassFailure> firstFailure(const PassOutcome& outcome) {
    if (outcome.storeFailure) return outcome.storeFailure;
    for (const PassTree& tree : outcome.trees)
        if (tree.out.why) return tree.out.why;
    for (const PassTree& tree : outcome.trees)
        if (tree.in.why) return tree.in.why;
    return std::nullopt;
}

PassWish wishForAPass(const Preferences& preferences) {
    const auto last = lastOutcome(preferences);
    return {last ? last->number : 0, secondsSinceBoot()};
}

bool answers(const PassOutcome& outcome, const PassWish& wish) {
    return outcome.number > wish.after && outcome.beganSinceBoot >= wish.sinceBoot;
}

} // namespace rolvane
