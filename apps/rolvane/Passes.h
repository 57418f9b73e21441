#pragma once

#include "Context.h"
#include "OutcomeWatch.h"
#include "PassWatch.h"

#include "foundation/Url.h"

#include <string>

namespace rolvane::cli {

inline constexpr double kPassSeconds = 3600; // a first publication over a slow line takes its time

// The owner's base location. Throws CommandError without a usable account.
Url ownBase();

// Draws the daemon's progress under the label until what was saved at that position of the journal has been through a
// pass, and gives its outcome: the daemon has taken the journal up to there, and a pass that began after `outcomes` was
// made has ended. (A daemon that watches a database for the first time takes the journal as read and scans the database
// instead.) `outcomes` is made after the save. Throws CommandError when the time is over or the daemon has ended
// without a word.
PassOutcome waitForPass(Context& context, PassWatch& watch, OutcomeWatch& outcomes, const std::string& label,
                        int64_t position, double seconds);

// One full pass, to its end: the running daemon's, or one of its own where none runs. Gives its outcome.
PassOutcome makePass(Context& context, double seconds);
// Is another pass likely to carry what this one left? So it is of a record that met a lock, and of a connection that a
// restart has cut.
bool mayGoBetter(const PassOutcome& outcome);
// A pass, and a second one where that may go better; tells how it went.
void sync(Context& context, double seconds);

} // namespace rolvane::cli
