#pragma once

// httpd's headers, in the one order in which C++ can read them: mod_dav.h has parameters and fields called "namespace".
#include <httpd.h>

#include <ap_provider.h>
#include <apr_strings.h>
#include <apr_uri.h>
#include <http_config.h>
#include <http_core.h>
#include <http_log.h>
#include <http_protocol.h>
#include <http_request.h>
#include <mod_auth.h>
#include <util_filter.h>
#include <util_xml.h>

// These are read by mod_dav.h too, and have to be before the word changes its meaning.
#include <ctime>
#include <string>
#ifdef __clang__
#pragma clang diagnostic push
#pragma clang diagnostic ignored "-Wkeyword-macro"
#endif
#define namespace namespace_
#include <mod_dav.h>
#undef namespace
#ifdef __clang__
#pragma clang diagnostic pop
#endif

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
