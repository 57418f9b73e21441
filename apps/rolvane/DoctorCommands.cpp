#include "Doctor.h"
#include "SetupCommands.h"
#include "Texts.h"
#include "ValueNames.h"

#include "foundation/Paths.h"

#include <array>
#include <filesystem>
#include <fmt/format.h>

namespace rolvane::cli {

namespace {

std::string label(const Finding& finding) {
    std::string text = finding.check;
    text[0] = static_cast<char>(std::toupper(static_cast<unsigned char>(text[0])));
    return translated(text.c_str());
}

// The checks, for the catalogs.
[[maybe_unused]] constexpr std::array<const char*, 16> kLabels{
    marked("Database"), marked("Preferences"), marked("Disk"),      marked("Account"),
    marked("Address"),  marked("Login"),       marked("Authority"), marked("Clock"),
    marked("Rights"),   marked("Webdav"),      marked("Structure"), marked("Computers"),
    marked("Bus"),      marked("Launcher"),    marked("Unit"),      marked("Queue"),
};

void tell(Context& context, const std::vector<Finding>& findings) {
    if (context.json) return context.print(findingsJson(findings));
    for (const Finding& finding : findings) {
        const char* mark = finding.state == Finding::State::failed ? "!! " : "";
        context.row(label(finding), mark + finding.what);
        if (!finding.toDo.empty()) context.row("", "`" + finding.toDo + "`");
    }
}

void doctor(Context& context, const std::string& bundle) {
    const std::vector<Finding> findings = Doctor(context).examine();
    tell(context, findings);
    if (!bundle.empty()) {
        const std::string path = std::filesystem::absolute(bundle).string();
        writeFileDurably(path, bundleOf(findings, ROLVANE_VERSION).dump(2) + "\n", 0600);
        context.say(tr("{} holds states and figures, and no names, numbers, addresses or secrets.", path));
    }
    if (!allWell(findings))
        context.exitCode = kFailed;
    else
        context.say(translated("All is well."));
}

} // namespace

void addDoctorCommands(CLI::App& app, Context& context) {
    const auto bundle = std::make_shared<std::string>();
    addCommand(
        app, context, "doctor",
        "Look at all that sharing needs; a sentence and a command for what is wrong (exit code 0 or 1)",
        [&](CLI::App& c) {
            c.add_option("--bundle", *bundle,
                         "Write a report for whoever helps you to this file, without names, numbers, addresses or "
                         "secrets")
                ->type_name(kFileValue);
        },
        [&context, bundle] { doctor(context, *bundle); });
}

} // namespace rolvane::cli
