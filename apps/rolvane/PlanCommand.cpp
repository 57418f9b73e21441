#include "PlanCommand.h"

#include "Counted.h"
#include "Publication.h"
#include "RecordJson.h"
#include "SafeText.h"
#include "Shares.h"
#include "Shown.h"
#include "Subscriptions.h"

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
    for (const char* kind : {"added", "changed", "deleted"})
        if (const size_t count = changes[kind]; count > 0)
            text += fmt::format("{}{} {}", text.empty() ? "" : ", ", count, kind);
    return text.empty() ? "no new edit" : text;
}

std::string waitingText(size_t waiting) {
    return waiting == 0 ? "" : fmt::format("; {} for the store", counted(waiting, "change waits", "changes wait"));
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
        context.line("Yours: nothing is published, so nothing leaves this computer.");
    else
        context.line(fmt::format("Yours: {} {} readable for {}{}.", shown.amount(), shown.isOne() ? "is" : "are",
                                 readers.empty() ? "nobody" : usersText(readers),
                                 writers.empty() ? "" : ", changeable for " + usersText(writers)));
    if (publishes && !daemonHasRun)
        context.line("       All of it goes to the store: the daemon has not run yet.");
    else if (publishes)
        context.line(fmt::format("       {} since the daemon looked last{}.", changesText(own["unseen"]),
                                 waitingText(ownWaiting)));
    for (const Json& s : others) {
        const size_t unsent = s["unsent"];
        context.line(fmt::format("{}: {}; {}.", shownLine(s["user"].get<std::string>()),
                                 s["writable"].get<bool>() ? "news comes, and your edits go there" : "news comes",
                                 unsent == 0 ? "nothing waits to be sent"
                                             : counted(unsent, "change waits", "changes wait") + " to be sent"));
    }
    context.say("`rolvane sync` carries it at once. --dry-run tells the same of publish, share, unpublish, subscribe, "
                "import and merge.");
}

} // namespace

void addPlanCommand(CLI::App& app, Context& context) {
    addCommand(app, context, "plan", "Tell what the next pass carries where, and who can read what", nullptr,
               [&context] { plan(context); });
}

} // namespace rolvane::cli
