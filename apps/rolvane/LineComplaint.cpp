#include "LineComplaint.h"

#include "Texts.h"

#include <regex>

namespace rolvane::cli {

std::string complaintAboutLine(const std::string& said) {
    static const std::regex missing("(.+) is required"),
        extra("The following arguments? (?:was|were) not expected: (.+)"),
        range("(.+): Value (.+) not in range ([-0-9]+).* to ([-0-9]+).*"), choice("(.+): (.+) not in \\{(.+)\\}"),
        number("Could not convert: (.+) = (.*)"), value("(.+): 1 required (.+) missing"),
        excluded("(.+) excludes (.+)"), needed("(.+) requires (.+)");
    constexpr size_t kDigits = 9; // more of them are no limit that anybody meets
    if (said == "A subcommand is required") return translated("A command is missing behind this one");
    std::smatch of;
    if (std::regex_match(said, of, missing)) return tr("{} is missing", of[1].str());
    if (std::regex_match(said, of, extra)) return tr("Nothing is known of: {}", of[1].str());
    if (std::regex_match(said, of, range) && of[4].length() > static_cast<std::ptrdiff_t>(kDigits))
        return tr("{} takes a number greater than {}, not \"{}\"", of[1].str(), of[3].str(), of[2].str());
    if (std::regex_match(said, of, range))
        return tr("{} takes a number from {} to {}, not \"{}\"", of[1].str(), of[3].str(), of[4].str(), of[2].str());
    if (std::regex_match(said, of, choice))
        return tr("{} takes one of {}, not \"{}\"", of[1].str(), of[3].str(), of[2].str());
    if (std::regex_match(said, of, number)) return tr("{} does not take \"{}\"", of[1].str(), of[2].str());
    if (std::regex_match(said, of, value)) return tr("{} lacks its value", of[1].str());
    if (std::regex_match(said, of, excluded)) return tr("{} and {} exclude each other", of[1].str(), of[2].str());
    if (std::regex_match(said, of, needed)) return tr("{} is of use with {} alone", of[1].str(), of[2].str());
    return said;
}

} // namespace rolvane::cli
