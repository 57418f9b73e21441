#pragma once

#include "Board.h"

namespace rolvane::board {

// One case; false when the pass has fewer operations. `disk`: 0 to 5.
bool breakDiskOnce(Work& work, const Scenario& scenario, size_t disk, size_t operation);
void breakDisk(Work& work);

} // namespace rolvane::board
