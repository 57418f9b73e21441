#include "CompleteCommand.h"

#include "Completion.h"
#include "CompletionValues.h"
#include "Context.h"
#include "ValueNames.h"

#include "daemon/DaemonOptions.h"

#include <iostream>

namespace rolvane::cli {

namespace {

struct Asked {
    std::string shell;
    std::vector<std::string> words; // the program first; the last one is to be completed
    ShellLine line;                 // bash's
};

Asked askedOf(const std::vector<std::string>& arguments) {
    Asked asked{arguments.empty() ? "" : arguments.front(), {}, {}};
    if (asked.shell == "bash" && arguments.size() == 3) {
        asked.line = shellLine(arguments[1], arguments[2]);
        asked.words = asked.line.words;
    } else if ((asked.shell == "zsh" || asked.shell == "fish") && arguments.size() >= 3) {
        asked.words.assign(arguments.begin() + 1, arguments.end());
        if (asked.shell == "fish") asked.words.back() = shellLine(asked.words.back(), "").words.back();
    } else {
        throw CommandError(kUsage,
                           "rolvane complete: this is for the shells' completion files. They call it as "
                           "`rolvane complete bash LINE BREAKS` or `rolvane complete zsh|fish PROGRAM WORD...`.");
    }
    return asked;
}

const CLI::App& tableOf(const std::string& program, const CLI::App& rolvane) {
    static CLI::App manager;
    if (program.substr(program.rfind('/') + 1) != "RolvaneManager") return rolvane;
    if (manager.get_options().size() == 1) { // help alone, which it has not
        manager.set_help_flag();
        for (const DaemonOption& option : kDaemonOptions) manager.add_flag(option.name, option.help);
    }
    return manager;
}

void print(const Asked& asked, const CompletionPoint& point, const std::vector<Offer>& offers) {
    std::cout << "offers\n";
    for (const Offer& offer : offers) {
        const std::string whole = point.before + offer.text;
        if (asked.shell != "bash")
            std::cout << whole << "\t" << offer.help << "\n";
        else
            std::cout << shellQuoted(std::string_view(whole).substr(std::min(asked.line.kept, whole.size())),
                                     asked.line.quote)
                      << "\n";
    }
}

} // namespace

int complete(const CLI::App& rolvane, int argc, char** argv) {
    Asked asked = askedOf({argv + 2, argv + argc});
    const CLI::App& table = tableOf(asked.words.front(), rolvane);
    asked.words.erase(asked.words.begin());
    const CompletionPoint point = completionPoint(table, asked.words);
    const std::string kind = point.value ? point.value->get_type_name() : "";
    if (kind == kFileValue || kind == kDirectoryValue) {
        std::cout << (kind == kFileValue ? "files\n" : "directories\n");
        return kOk;
    }
    std::vector<Offer> offers = offersOfTable(point);
    if (offers.empty() && point.value) offers = offersOfValues(kind, point);
    print(asked, point, offers);
    return kOk;
}

} // namespace rolvane::cli
