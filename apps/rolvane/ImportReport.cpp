#include "ImportReport.h"

#include "Counted.h"

#include <fmt/format.h>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

Json importReport(const VCardImportReport& report) {
    Json errors = Json::array();
    for (const VCardError& error : report.errors)
        errors.push_back({{"file", error.file}, {"line", error.line}, {"reason", error.reason}});
    return {{"imported", report.imported},
            {"updated", report.updated},
            {"unchanged", report.unchanged},
            {"groups", report.groups},
            {"missingMembers", report.missingMembers},
            {"bad", report.errorCount},
            {"errors", errors}};
}

} // namespace

void reportImport(Context& context, const VCardImportReport& report, size_t unreadable) {
    for (const VCardError& error : report.errors)
        context.warn(fmt::format("{}:{}: {}", error.file, error.line, error.reason));
    if (report.errorCount > report.errors.size())
        context.warn("and " + counted(report.errorCount - report.errors.size(), "more bad card", "more bad cards"));
    if (context.json)
        context.print(importReport(report));
    else
        context.say(fmt::format("{} imported, {} updated, {} unchanged, {}, {} left out.", report.imported,
                                report.updated, report.unchanged, counted(report.groups, "group", "groups"),
                                counted(report.errorCount, "bad card", "bad cards")));
    if (report.errorCount + unreadable > 0)
        context.exitCode = report.imported + report.updated + report.unchanged + report.groups > 0 ? kPartly : kFailed;
}

} // namespace rolvane::cli
