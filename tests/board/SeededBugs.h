#pragma once

#include "Board.h"

namespace rolvane::board {

// The programs are made to go wrong on purpose, one part of them after the other is left out, and the other rows'
// cases are tried until one fails; the same case has to go well with the programs as they are. A case of this row is a
// part, and a failure a part whose lack no case has noticed.
void findSeededBugs(Work& work);

} // namespace rolvane::board
