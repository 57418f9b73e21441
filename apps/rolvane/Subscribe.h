#pragma once

#include "Context.h"

#include <string>

namespace rolvane::cli {

// `rolvane subscribe USER`, to its end.
void subscribeTo(Context& context, const std::string& user);

} // namespace rolvane::cli
