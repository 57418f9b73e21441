#pragma once

#include "Board.h"

namespace rolvane::board {

void spoilRequests(Work& work);

} // namespace rolvane::board
