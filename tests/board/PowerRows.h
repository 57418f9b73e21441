#pragma once

#include "Board.h"

namespace rolvane::board {

// One case: the end of a pass, or of a command.
void losePowerOnce(Work& work, const Scenario& scenario, size_t number);
void losePowerBehindACommand(Work& work, size_t number);
void losePower(Work& work);

} // namespace rolvane::board
