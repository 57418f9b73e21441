#include "Conflicts.h"
#include "Context.h"
#include "RecordJson.h"
#include "Texts.h"
#include "ValueNames.h"

#include "contacts/records/Constants.h"

#include <fmt/format.h>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

constexpr size_t kShown = 60; // characters of a value in a line

std::string shown(const Dictionary& values, const std::string& property) {
    const Value& value = values[property];
    if (!value) return values.empty() ? translated("no value") : shown(values, values.begin()->first);
    if (value.isData()) return tr("{} bytes", value.data().size());
    std::string text = value.isString() ? value.string() : toJson(value).dump();
    for (char& c : text)
        if (static_cast<unsigned char>(c) < 0x20) c = ' ';
    if (text.size() <= kShown) return "\"" + text + "\"";
    size_t end = kShown;
    while (end > 0 && (static_cast<unsigned char>(text[end]) & 0xC0) == 0x80) --end; // whole characters
    return "\"" + text.substr(0, end) + "…\"";
}

Json conflictJson(const CXConflict& conflict) {
    const CXMergeConflict& merge = conflict.merge;
    return {{"number", conflict.number},
            {"identifier", conflict.uniqueId.str()},
            {"name", conflict.name},
            {"date", conflict.date.toISO8601()},
            {"property", merge.property},
            {"kept", toJson(Value(merge.kept))},
            {"lost", toJson(Value(merge.lost))},
            {"own", merge.winner == CXSide::theirs}, // the lost one was typed here
            {"keptText", shown(merge.kept, merge.property)},
            {"lostText", shown(merge.lost, merge.property)}};
}

CXConflict findConflict(Context& context, int64_t number) {
    if (auto found = context.database().conflict(number)) return *found;
    throw CommandError(kNotFound, tr("There is no conflict {}. `rolvane conflicts list` lists them.", number));
}

void listConflicts(Context& context) {
    const Json all = conflictsJson(context.database());
    if (context.json) return context.print(all);
    if (all.empty()) context.say(translated("No value gave way to another one."));
    for (const Json& each : all)
        context.line(fmt::format("{:>4}  {}", each["number"].get<int64_t>(), conflictText(each)));
}

void restoreConflict(Context& context, int64_t number) {
    const CXConflict conflict = findConflict(context, number);
    CXRolvane& database = context.database();
    const CXRecordRef record = database.recordForUniqueId(conflict.uniqueId);
    const CXMergeConflict& merge = conflict.merge;
    if (!record)
        throw CommandError(kNotFound, tr("{} is no longer there. The value was {}; `rolvane conflicts list "
                                         "--json` has it whole.",
                                         conflict.name, shown(merge.lost, merge.property)));
    if (const std::string reason = record->readOnlyReason(); !reason.empty()) throw CommandError(kRefused, reason);
    Dictionary replaced;
    for (const Dictionary& values : {merge.kept, merge.lost})
        for (const auto& [property, value] : values) {
            if (const Value now = record->valueForProperty(property)) replaced.set(property, now);
            record->setValue(merge.lost[property], property);
        }
    database.save();
    database.forgetConflict(number);
    context.say(tr("{} of {} is {} again. It was {}.", merge.property, conflict.name, shown(merge.lost, merge.property),
                   shown(replaced, merge.property)));
}

void forgetConflict(Context& context, int64_t number) {
    const CXConflict conflict = findConflict(context, number);
    context.database().forgetConflict(number);
    context.say(
        tr("Conflict {} is forgotten: {} of {} stays as it is.", number, conflict.merge.property, conflict.name));
}

} // namespace

Json conflictsJson(CXRolvane& database) {
    Json all = Json::array();
    for (const CXConflict& conflict : database.conflicts()) all.push_back(conflictJson(conflict));
    return all;
}

std::string conflictText(const Json& conflict) {
    return tr("{} of {}: {} was kept, {} {} gave way, on {}", conflict["property"].get<std::string>(),
              conflict["name"].get<std::string>(), conflict["keptText"].get<std::string>(),
              conflict["own"].get<bool>() ? translated("your") : translated("the other"),
              conflict["lostText"].get<std::string>(), shownDate(conflict["date"].get<std::string>()));
}

void addConflictCommands(CLI::App& app, Context& context) {
    CLI::App* conflicts = addCommand(app, context, "conflicts",
                                     "Values that two people changed at once: list, put back", nullptr, nullptr);
    conflicts->require_subcommand(1);
    const auto number = std::make_shared<int64_t>();
    const auto numbered = [number](CLI::App& command) {
        command.add_option("number", *number, "Number in the list")->required()->type_name(kConflictValue);
    };
    addCommand(*conflicts, context, "list", "List what was kept, and what gave way", nullptr,
               [&context] { listConflicts(context); });
    addCommand(*conflicts, context, "restore", "Put back a value that gave way", numbered,
               [&context, number] { restoreConflict(context, *number); });
    addCommand(*conflicts, context, "forget", "Leave the contact as it is", numbered,
               [&context, number] { forgetConflict(context, *number); });
}

} // namespace rolvane::cli
