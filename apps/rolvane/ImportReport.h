#pragma once

#include "Context.h"

#include "contacts/vcard/VCardImport.h"

#include <string>
#include <vector>

namespace rolvane::cli {

// Tells what an import did, or would do: each bad card, each line that was kept or lost, each column without a place,
// by itself; and sets the exit code. `unreadable`: files that could not be read.
void reportImport(Context& context, const VCardImportReport& report, size_t unreadable, bool dryRun = false);

// `rolvane import FILE...`
void importFiles(Context& context, const std::vector<std::string>& files);

} // namespace rolvane::cli
