#include "LogCommands.h"

#include "Consent.h"
#include "Lookup.h"
#include "RecordJson.h"
#include "SafeText.h"
#include "Shares.h"
#include "Subscriptions.h"
#include "Texts.h"
#include "ValueNames.h"

#include "contacts/database/History.h"
#include "contacts/records/RecordKind.h"
#include "foundation/PropertyList.h"

#include <algorithm>
#include <fmt/format.h>
#include <functional>
#include <set>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

constexpr const char* kHere = "rolvane";
constexpr const char* kDaemon = "RolvaneManager";
constexpr const char* kBooks = "books";
constexpr const char* kUndo = "undo";
constexpr size_t kShown = 50; // changes

struct LogOptions {
    std::string contact;
    size_t limit = kShown;
    bool purge = false, yes = false;
};

// The record that is meant: one that is here, or one that was deleted.
UniqueId findInHistory(CXRolvane& database, const std::string& named) {
    const auto gone = [&]() -> std::optional<UniqueId> {
        const auto found = CXHistory(database).deletedNamed(named);
        return found.empty() ? std::nullopt : std::optional(found.front());
    };
    if (!peopleMatching(database, named, true).empty()) return findPerson(database, named, true)->uniqueId();
    for (const CXListing& group : database.listGroups(std::nullopt))
        if (group.displayName == named || group.uniqueId.str() == named) return group.uniqueId;
    if (const auto deleted = gone()) return *deleted;
    return findPerson(database, named)->uniqueId(); // a part of a name, or the error that says what there is
}

// The author of the change: this computer's program, a device, or somebody on the store.
std::string byWhom(CXRolvane& database, const CXLoggedChange& change, const std::vector<CXChangeDetail>& details) {
    if (change.program == kHere)
        return change.command.empty() ? translated("here") : tr("here, `rolvane {}`", change.command);
    if (change.program == kBooks) return translated("an address book's client");
    if (change.program != kDaemon) return tr("here, {}", change.program);
    std::set<std::string> publishers;
    bool own = false;
    for (const CXChangeDetail& detail : details) {
        if (!cxIsSubscribed(detail.uniqueId)) {
            own = true;
            continue;
        }
        Dictionary properties;
        if (detail.before && detail.kind != CXDetailKind::chosen)
            properties = BinaryValue::decode(*detail.before).dictionary();
        else
            properties = CXHistory(database).after(detail);
        const std::string publisher = publisherOf(RemoteLocation(locationOf(RecordKind::subscribedPerson, properties)));
        publishers.insert(publisher.empty() ? translated("a publisher") : publisher);
        if (publishers.size() > 1) break;
    }
    std::string text;
    if (own) {
        const std::vector<std::string> writers = Shares(database).writers();
        text = writers.size() == 1 ? writers.front() : translated("a subscriber who may write");
    }
    for (const std::string& publisher : publishers) text += (text.empty() ? "" : ", ") + publisher;
    return text.empty() ? translated("the daemon") : text;
}

std::string amountOf(const CXLoggedChange& change) {
    std::string text;
    if (change.people > 0) text = countedText(change.people, "person", "people");
    if (change.groups > 0) text += (text.empty() ? "" : ", ") + countedText(change.groups, "group", "groups");
    return text.empty() ? translated("memberships") : text;
}

const char* verb(CXDetailKind kind) {
    switch (kind) {
    case CXDetailKind::added: return "added";
    case CXDetailKind::changed: return "changed";
    case CXDetailKind::deleted: return "deleted";
    case CXDetailKind::joined: return "joined";
    case CXDetailKind::left: return "left";
    case CXDetailKind::chosen: return "chosen";
    }
    return "";
}

// A value as text: the values of a list with their labels.
std::string valueText(const Value& value, const std::function<std::string(const Value&)>& single) {
    const auto several = CXMultiValue::fromValue(value);
    if (!several) return single(value);
    std::string text;
    for (const CXMultiValue::Entry& entry : several->entries())
        text += (text.empty() ? "" : ", ") + entry.label + ": " + single(entry.value);
    return text;
}

// For programs, the same everywhere.
Json valueJson(const Value& value) {
    if (!value) return nullptr;
    const std::string text = valueText(value, [](const Value& single) { return single.description(); });
    return text.empty() ? "nothing" : text;
}

std::string cutValue(const Value& value) {
    constexpr size_t kColumns = 60;
    const std::string text = value ? valueText(value, oneLine) : "";
    return text.empty() ? translated("nothing") : cutTo(shownLine(text), kColumns);
}

struct Difference {
    std::string property;
    Value before, after;
};

std::vector<Difference> differencesOf(CXHistory& history, const CXChangeDetail& detail) {
    std::vector<Difference> found;
    if (detail.kind != CXDetailKind::changed || !detail.before) return found;
    const Dictionary before = BinaryValue::decode(*detail.before).dictionary(), after = history.after(detail);
    std::set<std::string> names;
    for (const Dictionary& each : {before, after})
        for (const auto& [property, value] : each) names.insert(property);
    for (const std::string& property : names)
        if (before[property] != after[property]) found.push_back({property, before[property], after[property]});
    return found;
}

std::string nameOf(CXRolvane& database, const UniqueId& uid) {
    const CXRecordRef record = database.recordForUniqueId(uid);
    if (const auto person = std::dynamic_pointer_cast<CXPerson>(record)) return person->displayName();
    if (const auto group = std::dynamic_pointer_cast<CXGroup>(record)) return group->name();
    return uid.str();
}

Json detailJson(CXRolvane& database, CXHistory& history, const CXChangeDetail& detail) {
    Json data{{"identifier", detail.uniqueId.str()}, {"name", history.nameOf(detail)}, {"kind", verb(detail.kind)}};
    if (!detail.group.empty()) data["group"] = nameOf(database, detail.group);
    if (detail.kind == CXDetailKind::changed) {
        Json properties = Json::array();
        for (const Difference& each : differencesOf(history, detail))
            properties.push_back(
                {{"property", each.property}, {"before", valueJson(each.before)}, {"after", valueJson(each.after)}});
        data["properties"] = properties;
    }
    return data;
}

void tellDetail(Context& context, CXHistory& history, const CXChangeDetail& detail) {
    const std::string name = shownLine(history.nameOf(detail));
    if (!detail.group.empty()) {
        const std::string group = shownLine(nameOf(context.database(), detail.group));
        return context.line(detail.kind == CXDetailKind::chosen
                                ? tr("      {}: another value is used in {}", name, group)
                            : detail.kind == CXDetailKind::joined ? tr("      {} joined {}", name, group)
                                                                  : tr("      {} left {}", name, group));
    }
    context.line(detail.kind == CXDetailKind::added     ? tr("      {} added", name)
                 : detail.kind == CXDetailKind::changed ? tr("      {} changed", name)
                                                        : tr("      {} deleted", name));
    for (const Difference& each : differencesOf(history, detail))
        context.line(fmt::format("        {}: {} -> {}", shownLine(translated(each.property.c_str())),
                                 cutValue(each.before), cutValue(each.after)));
}

void forgetContact(Context& context, const UniqueId& uid, const LogOptions& options) {
    CXHistory history(context.database());
    const size_t changes = history.latest(SIZE_MAX >> 1, uid).size();
    requireConsent(context, options.yes,
                   tr("Forget what is kept of {} in {}? Nothing of it can be taken back then.", options.contact,
                      countedText(changes, "change", "changes")),
                   translated("Nothing was forgotten."));
    history.forget(uid);
    context.say(tr("The log knows nothing of {} any more.", options.contact));
}

void showLog(Context& context, const LogOptions& options) {
    CXRolvane& database = context.database();
    CXHistory history(database);
    std::optional<UniqueId> of;
    if (!options.contact.empty()) of = findInHistory(database, options.contact);
    if (options.purge && !of) throw CommandError(kUsage, translated("Name the contact that is to be forgotten."));
    if (options.purge) return forgetContact(context, *of, options);
    Json all = Json::array();
    for (const CXLoggedChange& change : history.latest(options.limit, of)) {
        const std::vector<CXChangeDetail> details = history.details(change.number, of);
        const std::string who = byWhom(database, change, details);
        if (context.json) {
            Json listed = Json::array();
            if (of)
                for (const CXChangeDetail& detail : details) listed.push_back(detailJson(database, history, detail));
            Json data{{"number", change.number},   {"date", change.date.toISO8601()}, {"by", who},
                      {"program", change.program}, {"command", change.command},       {"people", change.people},
                      {"groups", change.groups},   {"takenBack", change.isUndone}};
            if (of) data["details"] = listed;
            all.push_back(data);
            continue;
        }
        context.line(fmt::format("{:>4}  {}  {}  {}{}", change.number, shownDate(change.date), amountOf(change),
                                 shownLine(who), change.isUndone ? translated("  (taken back)") : ""));
        if (of)
            for (const CXChangeDetail& detail : details) tellDetail(context, history, detail);
        else if (details.size() == 1)
            tellDetail(context, history, details.front());
    }
    if (context.json) return context.print(all);
    if (history.latest(1, of).empty())
        context.say(translated("No change is known. Changes are kept for 30 days."));
    else
        context.say(translated("`rolvane undo NUMBER` takes a change back."));
}

// The latest change that was made here and not taken back.
CXLoggedChange latestHere(CXHistory& history) {
    for (const CXLoggedChange& change : history.latest(1000))
        if (change.program == kHere && !change.isUndone && change.command != kUndo) return change;
    throw CommandError(kNotFound,
                       translated("There is no change of yours to take back. `rolvane log` lists all changes; name one "
                                  "by its number."));
}

CXLoggedChange changeToUndo(CXHistory& history, int64_t number) {
    if (number == 0) return latestHere(history);
    const auto change = history.change(number);
    if (!change)
        throw CommandError(kNotFound, tr("There is no change {}. `rolvane log` lists those of the last 30 "
                                         "days.",
                                         number));
    if (change->isUndone)
        throw CommandError(kRefused, tr("Change {} was taken back already. `rolvane log` has the change that "
                                        "did it; take that one back to have this one again.",
                                        number));
    return *change;
}

void undo(Context& context, int64_t number, bool dryRun) {
    CXRolvane& database = context.database();
    CXHistory history(database);
    const CXLoggedChange change = changeToUndo(history, number);
    const CXUndone undone = history.undo(change.number);
    if (dryRun)
        database.rollback();
    else if (database.hasUnsavedChanges())
        database.save();
    for (const std::string& each : undone.left) context.warn(each);
    if (!dryRun && undone.anything()) history.noteUndone(change.number);
    if (context.json)
        context.print({{"number", change.number},
                       {"broughtBack", undone.broughtBack},
                       {"asOwn", undone.asOwn},
                       {"removed", undone.removed},
                       {"changed", undone.changed},
                       {"memberships", undone.memberships},
                       {"left", undone.left},
                       {"dryRun", dryRun}});
    std::string what;
    const auto add = [&](size_t count, const std::string& text) {
        if (count > 0) what += (what.empty() ? "" : ", ") + text;
    };
    add(undone.broughtBack, undone.asOwn == 0 ? tr("{} brought back", shownNumber(undone.broughtBack))
                                              : tr("{} brought back as your own", shownNumber(undone.broughtBack)));
    add(undone.removed, tr("{} removed", shownNumber(undone.removed)));
    add(undone.changed, tr("{} changed back", shownNumber(undone.changed)));
    add(undone.memberships,
        countedText(undone.memberships, "membership or choice restored", "memberships or choices restored"));
    context.say(tr("Change {} of {}: {}.{}", change.number, shownDate(change.date),
                   what.empty() ? translated("nothing of it is left to take back") : what,
                   dryRun ? translated(" Nothing was changed: this was a trial.") : ""));
    if (!undone.left.empty()) context.exitCode = undone.anything() ? kPartly : kFailed;
}

} // namespace

void addLogCommands(CLI::App& app, Context& context) {
    const auto options = std::make_shared<LogOptions>();
    addCommand(
        app, context, "log", "Tell which changes were made, when, by whom, and from what to what",
        [&](CLI::App& command) {
            command.add_option("contact", options->contact, "Only of this person or group, deleted ones included")
                ->type_name(kPersonValue);
            command.add_option("--limit", options->limit, "Changes to show, the latest first")
                ->check(CLI::PositiveNumber)
                ->capture_default_str();
            command.add_flag("--purge", options->purge, "Forget what is kept of the contact; the contact itself stays");
            declareConsent(command, options->yes);
        },
        [&context, options] { showLog(context, *options); });
    const auto number = std::make_shared<int64_t>(0);
    const auto dryRun = std::make_shared<bool>(false);
    addCommand(
        app, context, kUndo, "Take a change back; what was changed again since stays",
        [&](CLI::App& command) {
            command.add_option("number", *number, "Of the log; without it, the latest change that was made here")
                ->check(CLI::PositiveNumber);
            command.add_flag("--dry-run", *dryRun, "Tell what would happen, and change nothing");
        },
        [&context, number, dryRun] { undo(context, *number, *dryRun); });
}

} // namespace rolvane::cli
