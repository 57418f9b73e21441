#pragma once

#include <optional>
#include <string>

namespace rolvane::cli {

// The daemon's unit, as the user's service manager has it.
struct UnitState {
    bool loaded = false, enabled = false, needsReload = false;
    bool confined = false; // NoNewPrivileges and PrivateTmp hold
};

// Asks the manager by systemctl. Nothing when none answers within five seconds.
std::optional<UnitState> managersUnitState();
// The answer of `systemctl show`. Pure.
UnitState unitStateFrom(const std::string& shown);

} // namespace rolvane::cli
