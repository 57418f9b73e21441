#include "Context.h"

namespace rolvane::cli {

void addPreferencesCommands(CLI::App&, Context&) {}

} // namespace rolvane::cli
