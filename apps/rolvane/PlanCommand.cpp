#include "PlanCommand.h"

#include "Publication.h"
#include "RecordJson.h"
#include "SafeText.h"
#include "Shares.h"
#include "Shown.h"
#include "Subscriptions.h"
#include "Texts.h"

#include "contacts/records/Identifier.h"
#include "daemon/DaemonControl.h"
#include "engine/memory/EngineState.h"

#include <fmt/format.h>
#include <map>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

constexpr const char* kDaemonProgram = "RolvaneManager";

// Records that other programs have saved since the daemon last looked, by what became of them in the end.
struct Unseen {
    std::map<UniqueId, CXChangeKind> records;

    size_t count(CXChangeKind kind, bool copies) const {
        size_t found = 0;
        for (const auto& [uid, what] : records) found += what == kind && cxIsSubscribed(uid) == copies;
        return found;
    }
    Json json(bool copies) const {
        return {{"added", count(CXChangeKind::inserted, copies)},
                {"changed", count(CXChangeKind::updated, copies)},
                {"deleted", count(CXChangeKind::deleted, copies)}};
    }
};

Unseen unseenByTheDaemon(CXRolvane& database) {
    Unseen unseen;
    int64_t after = database.cursorPosition(kDaemonProgram);
    if (after < 0) return unseen; // it has never run: everything that is published is new to it
    for (;;) {
        const auto entries = database.journalEntries(after);
        if (entries.empty()) return unseen;
        for (const CXJournalEntry& entry : entries) {
            after = entry.sequence;
            if (entry.program == kDaemonProgram) continue;
            const auto [place, isFirst] = unseen.records.try_emplace(entry.uniqueId, entry.kind);
            if (isFirst) continue;
            const bool wasNew = place->second == CXChangeKind::inserted;
            if (wasNew && entry.kind == CXChangeKind::deleted)
                unseen.records.erase(place);
            else if (!wasNew)
                place->second = entry.kind;
        }
    }
}

std::string changesText(const Json& changes) {
    std::string text;
    const auto add = [&](const char* kind, const std::string& words) {
        if (changes[kind] > 0) text += (text.empty() ? "" : ", ") + words;
    };
    add("added", tr("{} added", shownNumber(changes["added"])));
    add("changed", tr("{} changed", shownNumber(changes["changed"])));
    add("deleted", tr("{} deleted", shownNumber(changes["deleted"])));
    return text.empty() ? translated("no new edit") : text;
}

std::string waitingText(size_t waiting) {
    return waiting == 0 ? "" : tr("; {} for the store", countedText(waiting, "change waits", "changes wait"));
}

// "Yours: 318 people and 6 groups are readable for 2 users (bob and carol), changeable for 1 user (bob)."
std::string readableText(const Shown& shown, const std::vector<std::string>& readers,
                         const std::vector<std::string>& writers) {
    const std::string who = readers.empty() ? translated("nobody") : usersText(readers);
    const std::string more = writers.empty() ? "" : tr(", changeable for {}", usersText(writers));
    return shown.isOne() ? tr("Yours: {} is readable for {}{}.", shown.amount(), who, more)
                         : tr("Yours: {} are readable for {}{}.", shown.amount(), who, more);
}

void plan(Context& context) {
    CXRolvane& database = context.database();
    Preferences& preferences = Preferences::shared();
    const Shown shown = shownToReaders(database);
    const Shares shares(database);
    const std::vector<std::string> readers = shares.readers(), writers = shares.writers();
    const bool publishes = Publication(database).anything();
    const bool daemonHasRun = database.cursorPosition(kDaemonProgram) >= 0;
    const Unseen unseen = unseenByTheDaemon(database);
    size_t ownWaiting = 0;
    for (const CXDChangeRecordPtr& record : EngineState(preferences).getPendingChanges())
        ownWaiting += record->changeMadeByDataOwner();

    Json own{{"people", shown.people.size()},
             {"groups", shown.groups.size()},
             {"readers", readers},
             {"writers", writers},
             {"published", publishes},
             {"pending", ownWaiting},
             {"unseen", unseen.json(false)}};
    Json others = Json::array();
    for (const CXSubscriptionRef& s : subscriptionsToPeople(database))
        others.push_back({{"user", publisherOf(s->remoteLocation())},
                          {"writable", s->isWritable()},
                          {"pending", pendingFor(preferences, s->remoteLocation())},
                          {"unsent", unsentTo(database, preferences, s->remoteLocation())}});
    if (context.json)
        return context.print(
            {{"own", own}, {"subscriptions", others}, {"copies", unseen.json(true)}, {"daemonHasRun", daemonHasRun}});

    if (!publishes)
        context.line(translated("Yours: nothing is published, so nothing leaves this computer."));
    else
        context.line(readableText(shown, readers, writers));
    if (publishes && !daemonHasRun)
        context.line(translated("       All of it goes to the store: the daemon has not run yet."));
    else if (publishes)
        context.line(
            tr("       {} since the daemon looked last{}.", changesText(own["unseen"]), waitingText(ownWaiting)));
    for (const Json& s : others) {
        const size_t unsent = s["unsent"];
        context.line(fmt::format(
            "{}: {}; {}.", shownLine(s["user"].get<std::string>()),
            s["writable"].get<bool>() ? translated("news comes, and your edits go there") : translated("news comes"),
            unsent == 0 ? translated("nothing waits to be sent")
                        : tr("{} to be sent", countedText(unsent, "change waits", "changes wait"))));
    }
    context.say(translated(
        "`rolvane sync` carries it at once. --dry-run tells the same of publish, share, unpublish, subscribe, "
        "import and merge."));
}

} // namespace

void addPlanCommand(CLI::App& app, Context& context) {
    addCommand(app, context, "plan", "Tell what the next pass carries where, and who can read what", nullptr,
               [&context] { plan(context); });
}

} // namespace rolvane::cli
