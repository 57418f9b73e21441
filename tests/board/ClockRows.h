#pragma once

#include "Board.h"

namespace rolvane::board {

void turnClock(Work& work);

} // namespace rolvane::board
