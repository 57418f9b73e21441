#pragma once

#include "Context.h"
#include "PassWatch.h"

#include "foundation/Date.h"
#include "foundation/Url.h"

#include <string>

namespace rolvane::cli {

inline constexpr double kPassSeconds = 3600; // a first publication over a slow line takes its time

// The owner's base location. Throws CommandError without a usable account.
Url ownBase();

// Changes that wait in the daemon's queue.
int64_t pendingChanges();
// Says why changes are left waiting, with the store as it is now, and sets the exit code; nothing when none are.
void reportPending(Context& context);

// Draws the daemon's progress under the label until what was saved at that position of the journal and that date has
// been through a pass: the daemon has taken the journal up to there, and a pass has ended since. (A daemon that watches
// a database for the first time takes the journal as read and scans the database instead; a pass that was under way
// when the change was saved ends without it.) Throws CommandError when the time is over or the daemon has ended.
void waitForPass(Context& context, PassWatch& watch, const std::string& label, int64_t position, Date saved,
                 double seconds);

// One pass, to its end: the running daemon's, or one of its own where none runs.
void makePass(Context& context, double seconds);
// The same, a second time when changes are left, and tells how it went.
void sync(Context& context, double seconds);

} // namespace rolvane::cli
