#pragma once

#include "Context.h"

namespace rolvane::cli {

void addBackupCommands(CLI::App& app, Context& context); // backup restore

} // namespace rolvane::cli
