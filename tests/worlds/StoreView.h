#pragma once

#include "Model.h"

#include <string>

namespace rolvane::worlds {

// What lies on the server's disk below the owner's tree, in the same form as a copy; what no tree may hold, a file of
// nobody's for instance, is among its faults.
View viewOfStore(const std::string& tree);

} // namespace rolvane::worlds
