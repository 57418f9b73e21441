#pragma once

#include "Completion.h"

namespace rolvane::cli {

// The values that exist, of the kinds of ValueNames.h, which begin so; letter case does not matter. Changes nothing,
// asks no server and no daemon, and tells of no failure: where nothing can be read there are no values. Of many people
// only some are offered, but never so that what all begin with is more than it is. Texts that would steer a terminal
// are left out.
std::vector<Offer> offersOfValues(const std::string& kind, const CompletionPoint& point);

} // namespace rolvane::cli
