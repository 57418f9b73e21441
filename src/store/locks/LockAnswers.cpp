#include "store/locks/LockAnswers.h"

#include "store/dav/Multistatus.h"

namespace rolvane {

namespace {

LockAnswer judgeWithoutStatus(TransportError error) {
    // Neither was sent.
    const bool unsent = error == TransportError::refused || error == TransportError::tls;
    return unsent ? LockAnswer::notNow : LockAnswer::unheard;
}

} // namespace

LockAnswer judgeLockAnswer(const HttpResponse& answer) {
    if (!answer.complete()) return judgeWithoutStatus(answer.error);
    if (answer.ok()) return parseLockAnswer(answer.body) ? LockAnswer::granted : LockAnswer::unheard;
    if (answer.status >= 500 && answer.header("retry-after")) return LockAnswer::notNow;
    switch (answer.status) {
    case 423: return LockAnswer::held;
    case 403: return LockAnswer::notAllowed;
    case 405: // the method is not known there, or
    case 501: return LockAnswer::impossible;
    case 502: // somebody in between has lost the answer
    case 504: return LockAnswer::unheard;
    case 401: // who asks is not known, or
    case 407: // not let through, or
    case 408: // was too slow
    case 409: // there is no such tree, or
    case 410: // it has gone
    case 412: // an answer to conditions, and a LOCK carries none
    case 421: // another server's
    case 425: // too early
    case 429: // too many
    case 503: // too busy
    case 507: // too full
    case 207: return LockAnswer::notNow;
    default: return answer.status >= 400 ? LockAnswer::doubtful : LockAnswer::notNow;
    }
}

} // namespace rolvane
