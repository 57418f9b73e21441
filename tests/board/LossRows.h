#pragma once

#include "Board.h"

namespace rolvane::board {

// One case: the store loses files of a tree that everybody has in step, before somebody's pass. False when there are no
// more.
bool loseFilesOnce(Work& work, size_t number);
void loseFiles(Work& work);

} // namespace rolvane::board
