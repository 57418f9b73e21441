#pragma once

#include "Board.h"

namespace rolvane::board {

// One case; false when there are fewer.
bool turnClockOnce(Work& work, size_t number);
void turnClock(Work& work);

} // namespace rolvane::board
