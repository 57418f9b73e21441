#pragma once

#include "Board.h"

namespace rolvane::board {

// One case of that number: a file in somebody's home is damaged at a place of chance.
void damageOnce(Work& work, size_t number);
void damage(Work& work);

} // namespace rolvane::board
