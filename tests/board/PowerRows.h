#pragma once

#include "Board.h"

namespace rolvane::board {

void losePower(Work& work);

} // namespace rolvane::board
