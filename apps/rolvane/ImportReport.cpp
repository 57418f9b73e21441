#include "ImportReport.h"

#include "Counted.h"

#include <fmt/format.h>
#include <fmt/ranges.h>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

Json named(const std::vector<VCardError>& all) {
    Json list = Json::array();
    for (const VCardError& each : all)
        list.push_back({{"file", each.file}, {"line", each.line}, {"reason", each.reason}});
    return list;
}

Json importReport(const VCardImportReport& report, bool dryRun) {
    Json charsets = Json::array(), columns = Json::array();
    for (const VCardForeignText& each : report.foreign)
        charsets.push_back(
            {{"file", each.file}, {"charset", each.charset}, {"detected", each.detected}, {"lines", each.lines}});
    for (const VCardNoteColumns& each : report.intoTheNote)
        columns.push_back({{"file", each.file}, {"columns", each.columns}});
    return {{"imported", report.imported},
            {"updated", report.updated},
            {"unchanged", report.unchanged},
            {"groups", report.groups},
            {"missingMembers", report.missingMembers},
            {"bad", report.errorCount},
            {"doubtful", report.doubtful},
            {"linesLost", report.linesLost},
            {"dryRun", dryRun},
            {"errors", named(report.errors)},
            {"notices", named(report.notices)},
            {"charsets", charsets},
            {"intoTheNote", columns}};
}

void tellAll(Context& context, const std::vector<VCardError>& all, size_t count, const char* one, const char* more) {
    for (const VCardError& each : all) context.warn(each.description());
    if (count > all.size()) context.warn("and " + counted(count - all.size(), one, more));
}

void tellForeignText(Context& context, const VCardForeignText& foreign) {
    const std::string what = foreign.lines == 0 ? "the text" : counted(foreign.lines, "line", "lines");
    const std::string advice = foreign.detected ? " That is a guess; --charset names another one." : "";
    const bool one = foreign.lines <= 1;
    context.say(fmt::format("{}: {} {} not UTF-8 and {} read as {}.{}", foreign.file, what, one ? "is" : "are",
                            one ? "was" : "were", foreign.charset, advice));
}

} // namespace

void reportImport(Context& context, const VCardImportReport& report, size_t unreadable, bool dryRun) {
    tellAll(context, report.errors, report.errorCount, "more bad card", "more bad cards");
    tellAll(context, report.notices, report.noticeCount, "more of the kind", "more of the kind");
    for (const VCardForeignText& foreign : report.foreign) tellForeignText(context, foreign);
    for (const VCardNoteColumns& each : report.intoTheNote)
        context.say(fmt::format("{}: people have no place for {}; what stands there is kept in the note.", each.file,
                                fmt::join(each.columns, ", ")));
    if (report.missingMembers > 0)
        context.say(counted(report.missingMembers, "member of a group has", "members of groups have") +
                    " no card here. They are kept by their identifiers, and join when their cards come.");
    if (context.json)
        context.print(importReport(report, dryRun));
    else
        context.say(fmt::format("{} imported, {} updated, {} unchanged, {}, {} left out.", report.imported,
                                report.updated, report.unchanged, counted(report.groups, "group", "groups"),
                                counted(report.errorCount, "bad card", "bad cards")));
    if (dryRun) context.say("Nothing was changed: this was a trial.");
    if (report.errorCount + unreadable + report.linesLost > 0)
        context.exitCode = report.imported + report.updated + report.unchanged + report.groups > 0 ? kPartly : kFailed;
}

} // namespace rolvane::cli
