#include "Context.h"

namespace rolvane::cli {

void addGroupCommands(CLI::App&, Context&) {}

} // namespace rolvane::cli
