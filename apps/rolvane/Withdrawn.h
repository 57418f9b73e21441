#pragma once

#include <nlohmann/json.hpp>
#include <string>

namespace rolvane::cli {

// What is kept of subscriptions that their publishers ended, latest first, and one of them as text for people.
nlohmann::ordered_json withdrawnJson();
std::string withdrawnText(const nlohmann::ordered_json& record);

} // namespace rolvane::cli
