#include "Context.h"

namespace rolvane::cli {

void addAccountCommands(CLI::App&, Context&) {}

} // namespace rolvane::cli
