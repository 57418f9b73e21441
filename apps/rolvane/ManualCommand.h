#pragma once

#include <CLI/CLI.hpp>

namespace rolvane::cli {

// `rolvane manual PART`, which builds the manual page and which no help lists: Markdown of the common options
// ("options"), of every command ("commands"), of the exit codes ("exit-codes") or of RolvaneManager's options
// ("daemon-options"), from the tables that are parsed. Its exit code.
int manual(const CLI::App& rolvane, int argc, char** argv);

} // namespace rolvane::cli
