#pragma once

#include "foundation/Date.h"

#include <optional>
#include <string>

namespace rolvane {

class Preferences;

// Keys of the daemon's domain.
// True: another computer of the same person keeps the same published tree in step. Absent: it is the only one.
inline constexpr const char* kCXDOneOfSeveral = "CXDOneOfSeveral";
inline constexpr const char* kCXDComputer = "CXDComputer";         // this one: {"id", "machine"}
inline constexpr const char* kCXDComputerName = "CXDComputerName"; // a name of the person's choice
// The computers that the tree names, as this one last saw them: [{"id", "name", "seen"}].
inline constexpr const char* kCXDComputers = "CXDComputers";
// When this computer last told the tree of itself: {"id", "serial", "date"}.
inline constexpr const char* kCXDToldOfItself = "CXDToldOfItself";
// The serial number of a tree that was published from here, and is not any more.
inline constexpr const char* kCXDFormerTree = "CXDFormerTree";

// Does another computer write the owner's tree, too? Then everything there is read and merged like a writer's.
bool isOneOfSeveral(const Preferences& preferences);
// Both write the preferences at once. Where it is the only one again, the notes of the others go.
void becomeOneOfSeveral(Preferences& preferences);
void becomeTheOnlyOne(Preferences& preferences);

// The marks of one of this person's computers. A copy of the preferences on another machine is another computer.
struct Computer {
    std::string id;           // a random text
    std::string name;         // for people
    std::optional<Date> seen; // when it last told of itself, by its own clock
};
// Makes the identifier at its first use, and writes it at once. The name is the person's choice, else the machine's.
Computer thisComputer(Preferences& preferences);

} // namespace rolvane
