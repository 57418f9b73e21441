#pragma once

#include "Context.h"

namespace rolvane::cli {

void addPlanCommand(CLI::App& app, Context& context); // plan

} // namespace rolvane::cli
