#pragma once

#include <optional>
#include <string>

namespace rolvane::cli {

// The daemon's unit, as the user's service manager has it.
struct UnitState {
    bool loaded = false, enabled = false, needsReload = false;
    bool confined = false;  // NoNewPrivileges holds
    bool apart = false;     // PrivateUsers, without which a user manager leaves out what hides and protects files
    bool forbidden = false; // the kernel has refused the last start a user namespace
};

// Asks the manager by systemctl. Nothing when none answers within five seconds.
std::optional<UnitState> managersUnitState();
// The answer of `systemctl show`. Pure.
UnitState unitStateFrom(const std::string& shown);

} // namespace rolvane::cli
