#pragma once

#include "Context.h"

namespace rolvane::cli {

void addLogCommands(CLI::App& app, Context& context); // log undo

} // namespace rolvane::cli
