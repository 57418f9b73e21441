#pragma once

#include "Board.h"

#include <string>

namespace rolvane::board {

// One case; false when the pass has fewer requests.
bool spoilRequest(Work& work, const Scenario& scenario, size_t request, const std::string& kind);
void spoilRequests(Work& work);

} // namespace rolvane::board
