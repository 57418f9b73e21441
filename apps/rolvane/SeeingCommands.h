#pragma once

#include "Context.h"

namespace rolvane::cli {

void addSeeingCommands(CLI::App& app, Context& context); // who preview

} // namespace rolvane::cli
