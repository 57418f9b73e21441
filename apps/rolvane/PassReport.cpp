#include "PassReport.h"

#include "FailureText.h"
#include "Texts.h"

#include "daemon/DaemonControl.h"
#include "store/dav/CXDAVManager.h"

#include <fmt/format.h>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

int weight(ExitCode code) {
    return code == kRefused ? 3 : code == kUnreachable ? 2 : code == kOk ? 0 : 1;
}

void add(PassReport& report, ExitCode code, std::string line) {
    if (weight(code) > weight(report.code)) report.code = code;
    report.lines.push_back(std::move(line));
}

bool isOwn(const PassTree& tree) {
    return tree.user == kSelf;
}

std::string contactsOf(const PassTree& tree) {
    return isOwn(tree) ? translated("your own contacts") : tr("{}'s contacts", tree.user.str());
}

std::string since(const PassDirection& direction) {
    return direction.waitingSince ? tr(" since {}", shownDate(*direction.waitingSince)) : std::string();
}

FailureScene sceneOf(const PassTree& tree, bool incoming, Date at) {
    FailureScene scene = sceneOfTheAccount(at);
    scene.user = isOwn(tree) ? std::string() : tree.user.str();
    scene.reads = incoming;
    return scene;
}

Json dateOrNull(const std::optional<Date>& date) {
    return date ? Json(date->toISO8601()) : Json();
}

Json directionJson(const PassTree& tree, const PassDirection& direction, bool incoming, Date at) {
    return {{"asked", direction.asked},
            {"reached", direction.reached},
            {"carried", direction.carried},
            {"waiting", direction.waiting},
            {"refused", direction.refused},
            {"inStep", dateOrNull(direction.inStep)},
            {"waitingSince", dateOrNull(direction.waitingSince)},
            {"why", direction.why ? failureJson(*direction.why, sceneOf(tree, incoming, at)) : Json()}};
}

// Only what concerns all trees at once. True when there is nothing more to say of the single trees.
bool reportStore(PassReport& report, const PassOutcome& outcome) {
    const auto& failure = outcome.storeFailure;
    const FailureText text =
        failure ? failureText(*failure, sceneOfTheAccount(outcome.ended)) : FailureText{kFailed, {}, {}};
    // A refused password ends the pass, and the process with it.
    if (outcome.exception && !(failure && text.code == kRefused))
        add(report, kFailed,
            tr("An error has ended the pass: {} What is left is kept for the next one. The log is {}.",
               *outcome.exception, DaemonControl::logPath()));
    if (outcome.storage)
        add(report, kFailed,
            tr("What the pass did could not be stored here: {} Nothing that was saved is lost; once this is "
               "cured, `rolvane sync` goes on.",
               *outcome.storage));
    if (failure) add(report, text.code, text.what + " " + text.toDo);
    return failure.has_value();
}

void reportOut(PassReport& report, const PassTree& tree, bool storeIsTold, Date at) {
    const PassDirection& out = tree.out;
    const FailureText text = out.why ? failureText(*out.why, sceneOf(tree, false, at)) : FailureText{kFailed, {}, {}};
    const std::string why = storeIsTold || !out.why ? std::string() : " " + text.what + " " + text.toDo;
    const std::string waiting = countedText(out.waiting, "change", "changes"), whose = contactsOf(tree);
    const char* later = storeIsTold ? translated(", to be sent when the store can be reached again") : "";
    if (out.waiting == 1)
        add(report, text.code, tr("{} of {} waits{}{}.{}", waiting, whose, since(out), later, why));
    else if (out.waiting > 0)
        add(report, text.code, tr("{} of {} wait{}{}.{}", waiting, whose, since(out), later, why));
    if (tree.listsWait)
        add(report, text.code,
            tr("With whom you share was changed, and the store does not have it yet.{}", out.waiting > 0 ? "" : why));
    if (out.refused <= 0) return;
    const std::string refused = countedText(out.refused, "change", "changes"),
                      advice = isOwn(tree) ? translated("Have the store's administrator let you write in your tree.")
                                           : tr("Ask {} for `rolvane share {} --write`, then edit again.",
                                                tree.user.str(), CXDAVManager::vaultraUser());
    add(report, kRefused,
        out.refused == 1
            ? tr("{} of {} was refused: the store does not let you write there. {}", refused, whose, advice)
            : tr("{} of {} were refused: the store does not let you write there. {}", refused, whose, advice));
}

void reportIn(PassReport& report, const PassTree& tree, bool storeIsTold, Date at) {
    const PassDirection& in = tree.in;
    if (tree.ended)
        return add(
            report, kRefused,
            isOwn(tree)
                ? translated("The publication has ended: the store has nothing of it any more, does not let you read "
                             "it, or has another one in its place. `rolvane status` tells more, and `rolvane "
                             "publish` publishes again.")
                : tr("{} no longer shares with you, and what came from there has left: "
                     "`rolvane withdrawn list` shows what is kept of it.",
                     tree.user.str()));
    if (tree.leftAlone)
        return add(
            report, kFailed,
            isOwn(tree)
                ? translated("Your tree on the store was older than expected, or incomplete; it is published again.")
                : tr("What the store holds of {} is older than expected, or incomplete. It is "
                     "taken in again when {}'s daemon has been there.",
                     tree.user.str(), tree.user.str()));
    const FailureText text = in.why ? failureText(*in.why, sceneOf(tree, true, at)) : FailureText{kFailed, {}, {}};
    const std::string why = storeIsTold || !in.why ? std::string() : " " + text.what + " " + text.toDo;
    if (storeIsTold && isOwn(tree)) return; // nobody waits for that
    if (in.asked && !in.reached)
        add(report, in.why ? text.code : kUnreachable,
            tr("News about {} could not be read{}.{}", contactsOf(tree), since(in), why));
    else if (in.waiting == 1)
        add(report, text.code, tr("1 change to {} has not been taken in yet.{}", contactsOf(tree), why));
    else if (in.waiting > 0)
        add(report, text.code,
            tr("{} changes to {} have not been taken in yet.{}",
               shownNumber(static_cast<unsigned long long>(in.waiting)), contactsOf(tree), why));
}

} // namespace

PassReport reportOf(const PassOutcome& outcome, bool sentOnly) {
    PassReport report;
    const bool storeIsTold = reportStore(report, outcome);
    for (const PassTree& tree : outcome.trees) {
        if (sentOnly && !isOwn(tree)) continue;
        reportOut(report, tree, storeIsTold, outcome.ended);
        if (!sentOnly || tree.ended) reportIn(report, tree, storeIsTold, outcome.ended);
    }
    if (!report.lines.empty()) return report;
    if (!sentOnly && outcome.full && !outcome.storeReached)
        add(report, kUnreachable, translated("The store was not reached. The daemon tries again by itself."));
    else if (!sentOnly && outcome.anotherFollows)
        add(report, kFailed,
            translated("Another pass is needed, and follows by itself. `rolvane status` tells how it went."));
    else if (!sentOnly && !everythingIsUpToDate(outcome))
        add(report, kFailed,
            translated("The pass carried changes alone and did not look at the trees. `rolvane sync` does."));
    return report;
}

std::string whyWaiting(const PassTree& tree, const PassDirection& direction, bool incoming, Date at) {
    if (!direction.why) return {};
    const FailureText text = failureText(*direction.why, sceneOf(tree, incoming, at));
    return text.what + " " + text.toDo;
}

Json outcomeJson(const PassOutcome& outcome) {
    Json trees = Json::array();
    for (const PassTree& tree : outcome.trees)
        trees.push_back({{"user", isOwn(tree) ? CXDAVManager::vaultraUser() : tree.user.str()},
                         {"own", isOwn(tree)},
                         {"location", tree.location},
                         {"ended", tree.ended},
                         {"leftAlone", tree.leftAlone},
                         {"listsWait", tree.listsWait},
                         {"out", directionJson(tree, tree.out, false, outcome.ended)},
                         {"in", directionJson(tree, tree.in, true, outcome.ended)}});
    const PassReport report = reportOf(outcome);
    return {{"number", outcome.number},
            {"began", outcome.began.toISO8601()},
            {"ended", outcome.ended.toISO8601()},
            {"full", outcome.full},
            {"storeReached", outcome.storeReached},
            {"upToDate", everythingIsUpToDate(outcome)},
            {"sent", everythingIsSent(outcome)},
            {"anotherFollows", outcome.anotherFollows},
            {"failure",
             outcome.storeFailure ? failureJson(*outcome.storeFailure, sceneOfTheAccount(outcome.ended)) : Json()},
            {"exception", outcome.exception ? Json(*outcome.exception) : Json()},
            {"storage", outcome.storage ? Json(*outcome.storage) : Json()},
            {"trees", trees},
            {"messages", report.lines}};
}

Json outcomeJson(const std::optional<PassOutcome>& outcome) {
    return outcome ? outcomeJson(*outcome) : Json();
}

bool report(Context& context, const PassOutcome& outcome, const std::string& good, bool sentOnly) {
    const PassReport told = reportOf(outcome, sentOnly);
    for (const std::string& line : told.lines) context.warn(line);
    if (!told.lines.empty()) {
        context.exitCode = told.code;
        return false;
    }
    if (!good.empty()) context.say(good);
    return true;
}

} // namespace rolvane::cli
