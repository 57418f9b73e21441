#pragma once

#include <CLI/CLI.hpp>

namespace rolvane::cli {

// `rolvane complete SHELL ...`, which the shells ask (packaging/completions) and which no help lists:
//
//   rolvane complete bash LINE BREAKS           the line up to the cursor, and COMP_WORDBREAKS
//   rolvane complete zsh|fish PROGRAM WORD...   the words up to the cursor; fish's last word is as it was typed
//
// The first line that it prints says what kind of answer it is: "files", "directories" (the shell knows these best), or
// "offers": then each line is an offer, for zsh and fish with a tab and a help text behind it. For bash it is quoted as
// the line needs it. Looked at before the line is parsed, since the words are another line's. Its exit code.
int complete(const CLI::App& rolvane, int argc, char** argv);

} // namespace rolvane::cli
