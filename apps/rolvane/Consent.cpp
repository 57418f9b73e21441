#include "Consent.h"

#include "Questions.h"
#include "Texts.h"

#include <fmt/format.h>

namespace rolvane::cli {

void declareConsent(CLI::App& command, bool& yes) {
    command.add_flag("-y,--yes", yes, "Do not ask; needed where there is no terminal");
}

void requireConsent(Context& context, bool yes, const std::string& question, const std::string& unchanged) {
    if (yes) return;
    Questions questions(context, true);
    if (!questions.mayAsk())
        throw CommandError(kRefused, tr("\"{}\" cannot be asked: there is no terminal. {} Give --yes where the "
                                        "answer is yes.",
                                        question, unchanged));
    if (!questions.yes(question, false)) throw CommandError(kRefused, unchanged);
}

} // namespace rolvane::cli
