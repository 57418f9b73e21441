#pragma once

#include "Model.h"

#include <set>
#include <string>

namespace rolvane::worlds {

// What lies on the server's disk below the owner's tree, in the same form as a copy; what no tree may hold, a file of
// nobody's for instance, is among its faults. `furtherFiles` may stand beside contacts and groups.
View viewOfStore(const std::string& tree, const std::set<std::string>& furtherFiles = {});

} // namespace rolvane::worlds
