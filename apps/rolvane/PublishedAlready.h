#pragma once

#include "Context.h"

#include "foundation/Date.h"
#include "foundation/Preferences.h"
#include "model/Computers.h"
#include "store/dav/CXDAVManager.h"

#include <optional>
#include <string>
#include <vector>

namespace rolvane::cli {

// Whether contacts of an account are on its store already, and who put them there. A tree is this computer's when it
// bears the serial number that this database knows it by. It names computers that have told of themselves.
struct PublishedAlready {
    enum class By { nobody, thisComputer, another };
    By by = By::nobody;
    std::optional<Date> lastWrite; // by the store's clock
    std::vector<Computer> computers = {};
};

// Asks the account's store, which can be reached. Some requests; waits. The daemon learns the serial number when it
// reads the own tree for the first time; until then what `publishesHere`, and had a pass, is taken for its own.
PublishedAlready publishedAlready(CXDAVManager& store, const Preferences& preferences, bool publishesHere);

std::string publishedAlreadyText(const PublishedAlready& found); // a sentence, or two
nlohmann::ordered_json publishedAlreadyJson(const PublishedAlready& found);

} // namespace rolvane::cli
