#pragma once

#include "server/mod_davacl/Httpd.h"

namespace rolvane::davacl {

// What happens around mod_dav's own handling of a request that changes something:
//   before   a Destination that may not be written is refused with its reason; a list that was left behind by something
//            that is no more goes; the right to change is looked up again, with the lists held so that no list can
//            change until the request is through (with a body: when its last byte is here)
//   after    but before the answer: the lists of what was deleted go, and of what was moved go along
// Always DECLINED when the request may go on.
int prepareChange(request_rec* r) noexcept;
void registerChangeFilters();

} // namespace rolvane::davacl
