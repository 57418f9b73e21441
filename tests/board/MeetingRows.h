#pragma once

#include "Board.h"

namespace rolvane::board {

// Nothing befalls the pass. False when there are fewer cases.
bool calmOnce(Work& work, size_t number);
void calm(Work& work);

// A contact is written on the store by somebody else, without asking for the lock, between a pass's reading it and its
// writing it. One case: that write of a contact, counted from 0; false when the pass has fewer, or nobody else writes.
// With `newOnes` the pass has new contacts to write, else edits of all kinds.
bool meetOnce(Work& work, const Scenario& scenario, size_t write, bool newOnes = false);
void meet(Work& work);

} // namespace rolvane::board
