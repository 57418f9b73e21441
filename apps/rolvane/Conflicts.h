#pragma once

#include "contacts/database/CXRolvane.h"

#include <nlohmann/json.hpp>
#include <string>

namespace rolvane::cli {

// Values that gave way when two people changed one contact at once, oldest first, and one of them as text for people.
nlohmann::ordered_json conflictsJson(CXRolvane& database);
std::string conflictText(const nlohmann::ordered_json& conflict);

} // namespace rolvane::cli
