#pragma once

#include "Context.h"

#include "foundation/Preferences.h"
#include "foundation/Url.h"
#include "model/Computers.h"

#include <string>
#include <vector>

namespace rolvane {
class CXDAVManager;
}

namespace rolvane::cli {

void addComputerCommands(CLI::App& app, Context& context); // join computers leave

// The other computers that keep the owner's tree in step, as the daemon has seen them last.
std::vector<Computer> otherComputers(Preferences& preferences);
// The name and when it was last there, `"laptop" (last there 2026-05-01T10:00:00Z)`.
std::string computerText(const Computer& computer);
std::string computersText(const std::vector<Computer>& computers); // several, with commas and "and"
nlohmann::ordered_json computersJson(Preferences& preferences, const std::vector<Computer>& computers);

// The account's tree: whether it has contacts, and whose. Some requests; makes nothing.
struct OwnTree {
    std::string serial; // "" where there is none, or it cannot be read
    bool hasList = false;
    bool singleGroups = false;               // published by themselves: the list of everybody names nobody
    std::vector<std::string> people, groups; // of the list of everybody
    std::vector<Computer> computers;         // that have told of themselves
};
OwnTree lookAtOwnTree(CXDAVManager& store);

// Refuses where contacts lie in the tree that this computer did not put there.
void requireOwnTree(CXDAVManager& store, Preferences& preferences);
// Refuses a withdrawal while another computer keeps the tree in step.
void requireNoOtherComputer(CXDAVManager& store, Preferences& preferences);
// Tells the tree of this computer, once it has been published. What the store makes of it is of no matter.
void noteThisComputer(CXDAVManager& store, Preferences& preferences);

} // namespace rolvane::cli
