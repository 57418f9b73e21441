#pragma once

#include "server/HttpdHeaders.h"

#include <ap_provider.h>
#include <apr_uri.h>
#include <mod_auth.h>

extern "C" __attribute__((visibility("default"))) module AP_MODULE_DECLARE_DATA davacl_module;
APLOG_USE_MODULE(davacl);

namespace rolvane::davacl {

// httpd is C: whatever is thrown in a hook ends here, in its log, as the answer that the hook gives when it fails.
template <class Result, class Hook>
Result contained(request_rec* r, Result onFailure, Hook hook) noexcept {
    try {
        return hook();
    } catch (const std::exception& e) {
        ap_log_rerror(APLOG_MARK, APLOG_ERR, 0, r, "davacl: %s", e.what());
    } catch (...) {
        ap_log_rerror(APLOG_MARK, APLOG_ERR, 0, r, "davacl: failed");
    }
    return onFailure;
}

} // namespace rolvane::davacl
