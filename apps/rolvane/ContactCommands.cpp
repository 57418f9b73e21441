#include "Context.h"

namespace rolvane::cli {

void addContactCommands(CLI::App&, Context&) {}

} // namespace rolvane::cli
