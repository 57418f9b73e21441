#include "Context.h"

namespace rolvane::cli {

void addSharingCommands(CLI::App&, Context&) {}

} // namespace rolvane::cli
