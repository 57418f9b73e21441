#pragma once

#include "Stage.h"

#include <string>
#include <vector>

namespace rolvane::board {

// Everybody makes two clean passes, the given person first, and then one that has nothing to do. `later`: seconds that
// the daemons live behind; what a store has refused rests for a while.
struct Settling {
    char first = 'o';
    int64_t later = 0;
    bool knowsDeeds = true;  // the model knows what was done
    bool subscribes = false; // the others subscribe once the owner has made the first pass
};

struct Verdict {
    std::vector<std::string> wrong; // a line each
    bool late = false;              // all was well in the end, but not after two passes
};

// All that is wrong after that: what is lost, doubled or deleted by nobody in any copy, what the copies and the store
// do not agree about, what is not at rest, locks and temporary files that are left. Edits that cross take a pass of one
// person and then of another: so two more passes are made where something differs, and the verdict is late.
Verdict settleAndJudge(Stage& stage, const Settling& settling);

} // namespace rolvane::board
