#pragma once

#include "Context.h"

namespace rolvane::cli {

// The exit codes, once: `--help`, `rolvane help exit-codes` and the manual page show these.
struct ExitCodeText {
    ExitCode code;
    const char* meaning;
};
const std::vector<ExitCodeText>& exitCodeTexts();
std::string exitCodeLines(); // "Exit codes:" and a line each

void addHelpCommand(CLI::App& app, Context& context); // help [TOPIC]; the last command to be added

} // namespace rolvane::cli
