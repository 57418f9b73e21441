#pragma once

#include "server/mod_davacl/Configuration.h"
#include "server/mod_davacl/ListStore.h"

namespace rolvane::davacl {

// True when there are locks on the resource, and none of them is the request's user's.
bool isLockedByOthersOnly(request_rec* r, const dav_resource* resource);
// Whether the request's user took the lock that the request's Lock-Token names (RFC 3744 section 3.6: who took a lock
// may always give it back).
bool namesOwnLock(request_rec* r);
// Takes away every lock on the collection and below it whose holder may not write there by these lists: it could not be
// given back, and would keep those out who may write.
void removeLocksWithoutRight(request_rec* r, const Configuration& c, const dav_resource* collection,
                             const OwnersLists& lists);

} // namespace rolvane::davacl
