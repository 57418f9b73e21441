#pragma once

#include "conduits/UserAlert.h"
#include "foundation/Date.h"
#include "foundation/StrongString.h"
#include "foundation/Value.h"

#include <optional>
#include <vector>

namespace rolvane {

class Preferences;

// The owner's publication has ended because of the store's answer, and not by the owner's doing.
struct EndedPublication {
    Date when;
    bool replaced = false;              // another publication lies in its place; else it is gone or forbidden
    std::vector<UserName> mayStillRead; // the owner has taken their rights away, and the store does not know of it
    bool hadOthers = false;             // other computers of the owner kept it in step, and one has withdrawn it
};

// Kept in the daemon's domain until a pass has found something published again:
//   { "date": date, "replaced": boolean, "mayStillRead": [name], "hadOthers": boolean }
inline constexpr const char* kCXDEndedPublication = "CXDEndedPublication";
std::optional<EndedPublication> endedPublication(const Preferences& preferences);
// Writes the note and synchronises the domain.
void noteEndedPublication(Preferences& preferences, const EndedPublication& ended);

// The notice to the person at the desktop.
UserAlert::Text noticeOf(const EndedPublication& ended);

// The names that a sharing property of the prior state's groups has and `listed`, the database's, has not. In order,
// each once.
Array takenAway(const Dictionary& priorState, const char* property, const Array& listed);

} // namespace rolvane
