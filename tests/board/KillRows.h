#pragma once

#include "Board.h"

namespace rolvane::board {

// One case; false when the pass has fewer operations.
bool killOnce(Work& work, const Scenario& scenario, size_t operation);
// The same of a pass with new contacts. Between it and the clean passes its person takes them back, or gives each
// another number.
enum class Behind { takesBack, changesNumbers };
bool killWithNewOnes(Work& work, const Scenario& scenario, size_t operation, Behind behind);
void killEverywhere(Work& work);
void killTwice(Work& work);

} // namespace rolvane::board
