#pragma once

#include "Board.h"

namespace rolvane::board {

// One case; false when the pass has fewer operations.
bool killOnce(Work& work, const Scenario& scenario, size_t operation);
void killEverywhere(Work& work);
void killTwice(Work& work);

} // namespace rolvane::board
