#pragma once

#include "Board.h"

namespace rolvane::board {

void breakDisk(Work& work);

} // namespace rolvane::board
