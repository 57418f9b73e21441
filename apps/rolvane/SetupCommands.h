#pragma once

#include "Context.h"

namespace rolvane::cli {

void addSetupCommands(CLI::App& app, Context& context);  // setup
void addInviteCommands(CLI::App& app, Context& context); // invite
void addDoctorCommands(CLI::App& app, Context& context); // doctor

} // namespace rolvane::cli
