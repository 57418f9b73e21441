#include "ImportReport.h"

#include "Texts.h"

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
    if (count > all.size()) context.warn(tr("and {}", countedText(count - all.size(), one, more)));
}

void tellForeignText(Context& context, const VCardForeignText& foreign) {
    const std::string advice =
        foreign.detected ? translated(" That is a guess; --charset names another one.") : std::string();
    if (foreign.lines == 0)
        context.say(tr("{}: the text is not UTF-8 and was read as {}.{}", foreign.file, foreign.charset, advice));
    else if (foreign.lines == 1)
        context.say(tr("{}: 1 line is not UTF-8 and was read as {}.{}", foreign.file, foreign.charset, advice));
    else
        context.say(tr("{}: {} lines are not UTF-8 and were read as {}.{}", foreign.file, shownNumber(foreign.lines),
                       foreign.charset, advice));
}

} // namespace

void reportImport(Context& context, const VCardImportReport& report, size_t unreadable, bool dryRun) {
    tellAll(context, report.errors, report.errorCount, "more bad card", "more bad cards");
    tellAll(context, report.notices, report.noticeCount, "more of the kind", "more of the kind");
    for (const VCardForeignText& foreign : report.foreign) tellForeignText(context, foreign);
    for (const VCardNoteColumns& each : report.intoTheNote)
        context.say(tr("{}: people have no place for {}; what stands there is kept in the note.", each.file,
                       fmt::join(each.columns, ", ")));
    if (report.missingMembers > 0)
        context.say(tr("{} no card here. They are kept by their identifiers, and join when their cards come.",
                       countedText(report.missingMembers, "member of a group has", "members of groups have")));
    if (context.json)
        context.print(importReport(report, dryRun));
    else
        context.say(tr("{} imported, {} updated, {} unchanged, {}, {} left out.", shownNumber(report.imported),
                       shownNumber(report.updated), shownNumber(report.unchanged),
                       countedText(report.groups, "group", "groups"),
                       countedText(report.errorCount, "bad card", "bad cards")));
    if (dryRun) context.say(translated("Nothing was changed: this was a trial."));
    if (report.errorCount + unreadable + report.linesLost > 0)
        context.exitCode = report.imported + report.updated + report.unchanged + report.groups > 0 ? kPartly : kFailed;
}

} // namespace rolvane::cli
