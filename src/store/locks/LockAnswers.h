#pragma once

#include "store/http/HttpTransport.h"

namespace rolvane {

// What the answer to a request for a new lock says (RFC 4918 section 9.10). Pure.
enum class LockAnswer {
    granted,    // the body tells of the lock
    unheard,    // the lock may have been granted: the answer was lost, cut off, or is not one to a LOCK
    held,       // somebody holds it, perhaps an earlier request of ours
    notAllowed, // who may not lock may not write either, and the write is what says so
    impossible, // the server keeps no locks
    doubtful,   // the server keeps none, or is in trouble for a moment: see whether it says so again
    notNow,     // try another time
};
LockAnswer judgeLockAnswer(const HttpResponse& answer);

} // namespace rolvane
