#pragma once

#include "engine/pass/PassOutcome.h"

#include <vector>

namespace rolvane {

class CXDAVManager;

// The client's failed requests since the last call, as an outcome has them.
std::vector<PassFailure> takeFailures(CXDAVManager& store);

} // namespace rolvane
