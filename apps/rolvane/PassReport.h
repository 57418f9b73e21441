#pragma once

#include "Context.h"

#include "engine/pass/PassOutcome.h"

#include <string>
#include <vector>

namespace rolvane::cli {

// The commands' report of a pass: all that they say about it comes from here.
struct PassReport {
    ExitCode code = kOk;            // the worst result counts: refused, then not reached, then failed
    std::vector<std::string> lines; // whole sentences, each for one thing that is not as it should be
};

// Everything that this pass left, was refused, or did not reach. Without lines: all is well. `sentOnly`: what the
// publisher's side needs; other people's trees are left out.
PassReport reportOf(const PassOutcome& outcome, bool sentOnly = false);

// Why a direction of a tree is not in step, in a sentence or two; empty when it is.
std::string whyWaiting(const PassTree& tree, const PassDirection& direction, bool incoming, Date at);

nlohmann::ordered_json outcomeJson(const PassOutcome& outcome);
nlohmann::ordered_json outcomeJson(const std::optional<PassOutcome>& outcome); // null for none

// Warns with each line and sets the exit code; says `good` when there is none. True when all is well.
bool report(Context& context, const PassOutcome& outcome, const std::string& good, bool sentOnly = false);

} // namespace rolvane::cli
