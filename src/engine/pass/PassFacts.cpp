#include "engine/pass/PassFacts.h"

#include "model/RemoteLocationMap.h"

#include <algorithm>

namespace rolvane {

namespace {

// The last failure below the tree's base location, of a request that reads or of one that writes.
std::optional<PassFailure> failureBelow(const PassFacts& facts, const std::string& location, bool ofReads) {
    const auto reads = [](const std::string& method) {
        return method == "GET" || method == "HEAD" || method == "PROPFIND" || method == "OPTIONS";
    };
    std::optional<PassFailure> last;
    for (const PassFailure& failure : facts.failures)
        if (failure.url.starts_with(location) && reads(failure.method) == ofReads) last = failure;
    return last;
}

// Of the test of the store. The request that was in vain says more than the test as a whole.
std::optional<PassFailure> storeFailure(const PassFacts& facts) {
    if (!facts.storeFailure || facts.failures.empty()) return facts.storeFailure;
    PassFailure failure = facts.failures.back();
    failure.error = facts.storeFailure->error;
    return failure;
}

// Why something is left in one direction: its own requests, else those of the other, else the store as a whole.
std::optional<PassFailure> reason(const PassFacts& facts, const std::string& location, bool incoming) {
    if (!facts.storeReached && facts.storeFailure) return storeFailure(facts);
    auto found = failureBelow(facts, location, incoming);
    return found ? found : failureBelow(facts, location, !incoming);
}

void date(PassDirection& direction, bool isInStep, const PassDirection* before, Date ended) {
    direction.inStep = isInStep ? std::optional(ended) : before ? before->inStep : std::nullopt;
    if (isInStep) return;
    direction.waitingSince = before && before->waitingSince ? before->waitingSince : std::optional(ended);
}

// The owner's tree is not read before something is known of it.
TreeLook unlooked(const UserName& user, const PassFacts& facts) {
    return user == kSelf && facts.storeReached && !facts.exception ? TreeLook::read : TreeLook::notRead;
}

} // namespace

void countLeftOver(PassFacts& facts, const CXDChangeRecords& pending) {
    for (const CXDChangeRecordPtr& record : pending) {
        PassFacts::Counts& counts = facts.counts[record->user().value_or(UserName())];
        if (record->appliesToSources() & CXDSyncSourceVaultra) ++counts.toSend;
        if (record->appliesToSources() & CXDSyncSourceCX) ++counts.toReceive;
    }
}

PassOutcome outcomeOf(const PassFacts& facts, const std::optional<PassOutcome>& previous, Date ended) {
    PassOutcome outcome;
    outcome.number = (previous ? previous->number : 0) + 1;
    outcome.began = facts.began;
    outcome.ended = ended;
    outcome.beganSinceBoot = facts.beganSinceBoot;
    outcome.full = facts.full;
    outcome.storeReached = facts.storeReached;
    outcome.anotherFollows = facts.anotherFollows;
    outcome.storeFailure = storeFailure(facts);
    outcome.exception = facts.exception;
    outcome.storage = facts.storage;

    std::vector<PassFacts::Shared> shared;
    if (facts.shared)
        shared = *facts.shared;
    else if (previous)
        for (const PassTree& tree : previous->trees)
            if (!tree.ended) shared.push_back({tree.user, tree.location, tree.listsWait});
    for (const auto& entry : facts.looks) { // what has ended is in the database no more
        const bool known =
            std::any_of(shared.begin(), shared.end(), [&](const auto& each) { return each.user == entry.first; });
        if (!known && entry.second == TreeLook::ended) shared.push_back({entry.first, {}, false});
    }

    for (const PassFacts::Shared& each : shared) {
        PassTree tree;
        tree.user = each.user;
        tree.location = each.location;
        tree.listsWait = each.listsWait;
        const PassTree* known = previous ? previous->tree(each.user) : nullptr;
        if (known && tree.location.empty()) tree.location = known->location;
        if (known && known->location != tree.location) known = nullptr;
        const auto found = facts.counts.find(each.user);
        const PassFacts::Counts counts = found == facts.counts.end() ? PassFacts::Counts() : found->second;
        const auto look = facts.looks.find(each.user);

        tree.out.asked = counts.toldToSend || counts.toSend > 0 || tree.listsWait;
        tree.out.reached = tree.out.asked && facts.storeReached;
        tree.out.carried = counts.sent;
        tree.out.waiting = counts.toSend;
        tree.out.refused = counts.refused + counts.resting;
        if (facts.retry && known && counts.resting == 0) tree.out.refused += known->out.refused;
        const bool outInStep = counts.toSend == 0 && tree.out.refused == 0 && !tree.listsWait;
        date(tree.out, outInStep, known ? &known->out : nullptr, ended);
        if (!outInStep) tree.out.why = reason(facts, tree.location, false);

        tree.in.asked = facts.full;
        tree.in.carried = counts.received;
        tree.in.waiting = counts.toReceive;
        if (facts.full) {
            const TreeLook how = look != facts.looks.end() ? look->second : unlooked(each.user, facts);
            tree.ended = how == TreeLook::ended;
            tree.leftAlone = how == TreeLook::leftAlone;
            tree.in.reached = how != TreeLook::notRead;
            const bool inStep = how == TreeLook::read && counts.toReceive == 0;
            date(tree.in, inStep, known ? &known->in : nullptr, ended);
            if (!inStep) tree.in.why = reason(facts, tree.location, true);
        } else if (known) { // a pass that carries changes alone does not look there
            tree.leftAlone = known->leftAlone;
            tree.in.inStep = known->in.inStep;
            tree.in.waitingSince = known->in.waitingSince;
            tree.in.why = known->in.why;
        }
        outcome.trees.push_back(std::move(tree));
    }
    return outcome;
}

} // namespace rolvane
