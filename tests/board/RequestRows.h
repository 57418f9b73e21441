#pragma once

#include "Board.h"

#include <string>

namespace rolvane::board {

// One case; false when the pass has fewer requests.
enum class Spoils {
    all,
    writes,  // requests that change something; others are not counted
    listings // of collections, of a server that cannot tell their changes; others are not counted
};
bool spoilRequest(Work& work, const Scenario& scenario, size_t request, const std::string& kind,
                  Spoils spoils = Spoils::all);
// A pass has all its writes answered so, from that one on. False when it has fewer writes.
bool spoilWrites(Work& work, const Scenario& scenario, size_t write, const std::string& kind);
// A pass with new contacts has all its writes answered so, from that one on. Then its person takes the contacts back.
bool spoilNewOnes(Work& work, const Scenario& scenario, size_t write, const std::string& kind);
void spoilRequests(Work& work);

} // namespace rolvane::board
