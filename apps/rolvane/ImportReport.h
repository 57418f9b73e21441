#pragma once

#include "Context.h"

#include "contacts/VCardImport.h"

namespace rolvane::cli {

// Tells what an import did, each bad card by itself, and sets the exit code. `unreadable`: files that could not be
// read.
void reportImport(Context& context, const VCardImportReport& report, size_t unreadable);

} // namespace rolvane::cli
