#pragma once

#include "foundation/Preferences.h"

#include <string>

namespace rolvane {

// A command has taken a user's right back, on the own store first and in the database. What is remembered of the lists
// loses it here, too. A computer that is one of several would else find that the store has lost the right, take that
// for the other computer's doing, and a right granted anew before the next pass would go with it. The daemon rests, and
// the database is saved. `reading`: all rights; else the right to write alone. Does nothing while a list waits to be
// saved on the store: that list may hold the right, and the next pass has to find that the database does not.
void forgetRightTakenBack(Preferences& preferences, const std::string& user, bool reading);

} // namespace rolvane
