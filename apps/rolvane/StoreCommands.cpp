#include "Context.h"

namespace rolvane::cli {

void addStoreCommands(CLI::App&, Context&) {}

} // namespace rolvane::cli
