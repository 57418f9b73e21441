#pragma once

#include "contacts/database/CXRolvane.h"
#include "foundation/Date.h"
#include "support/TempHome.h"

namespace rolvane::test {

// The daemon's view of the contact database in `directory`: nothing leaves the process. Clock and centre are borrowed.
inline CXRolvane::Options daemonDatabase(const TempDirectory& directory, ManualClock& clock,
                                         NotificationCenter& center) {
    CXRolvane::Options options;
    options.path = directory / "contacts.db";
    options.program = "RolvaneManager";
    options.clock = &clock;
    options.center = &center;
    return options;
}

} // namespace rolvane::test
