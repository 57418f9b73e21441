#include "engine/pass/StoreFailures.h"

#include "store/dav/CXDAVManager.h"
#include "store/http/RequestFailures.h"

namespace rolvane {

namespace {

int errorOf(const RequestFailure& failure) {
    if (failure.status != 0) return 0;
    switch (failure.error) {
    case TransportError::timedOut: return kCXDAVErrorTimedOut;
    case TransportError::tls: return kCXDAVErrorSecureConnection;
    case TransportError::none:
    case TransportError::tooLarge: return kCXDAVErrorBadServerResponse;
    default: return kCXDAVErrorCannotConnect;
    }
}

} // namespace

std::vector<PassFailure> takeFailures(CXDAVManager& store) {
    std::vector<PassFailure> failures;
    for (RequestFailure& failure : store.failures().take())
        failures.push_back({failure.method, failure.name.absoluteString(), failure.status, errorOf(failure),
                            std::move(failure.words), failure.retryAfterSeconds});
    return failures;
}

} // namespace rolvane
