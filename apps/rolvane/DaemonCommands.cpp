#include "Context.h"

namespace rolvane::cli {

void addDaemonCommands(CLI::App&, Context&) {}

} // namespace rolvane::cli
