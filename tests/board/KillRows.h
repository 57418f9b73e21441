#pragma once

#include "Board.h"

namespace rolvane::board {

void killEverywhere(Work& work);
void killTwice(Work& work);

} // namespace rolvane::board
