#pragma once

#include "Context.h"

#include <string>

namespace rolvane::cli {

// Before a command takes something away, or shows more to others, the person is asked.
void declareConsent(CLI::App& command, bool& yes); // -y, --yes

// Returns where the person wants it: `yes` was given, or the question was answered so at a terminal. Otherwise throws
// CommandError kRefused, that has `unchanged` ("Nothing was deleted.") in it. A pipe's answer counts for nothing: what
// is written there may be meant for another question.
void requireConsent(Context& context, bool yes, const std::string& question, const std::string& unchanged);

} // namespace rolvane::cli
