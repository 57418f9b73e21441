// mod_davacl: access lists (RFC 3744) for the trees that mod_dav serves. Load it after mod_dav. See docs/mod_davacl.md.

#include "server/mod_davacl/AclMethod.h"
#include "server/mod_davacl/Changes.h"
#include "server/mod_davacl/Configuration.h"
#include "server/mod_davacl/Confinement.h"
#include "server/mod_davacl/Enforcement.h"
#include "server/mod_davacl/LiveProperties.h"
#include "server/mod_davacl/NetworkWaits.h"
#include "server/mod_davacl/Newcomers.h"
#include "server/mod_davacl/Parking.h"
#include "server/mod_davacl/Passwords.h"
#include "server/mod_davacl/PrincipalResources.h"
#include "server/mod_davacl/Reports.h"
#include "server/mod_davacl/Uploads.h"
#include "server/mod_davacl/WaitingRequests.h"

#include <http_connection.h>
#include <mpm_common.h>

namespace rolvane::davacl {
namespace {

int beforeConfiguration(apr_pool_t* pool, apr_pool_t*, apr_pool_t*) noexcept {
    registerAclMethod(pool);
    return OK;
}

// mod_dav wants a place to look for property sets; ours are found by name.
void gatherPropertySets(apr_array_header_t*) noexcept {}

void registerHooks(apr_pool_t* pool) noexcept {
    static const char* const beforeDav[] = {"mod_dav.c", nullptr};
    ap_hook_pre_config(beforeConfiguration, nullptr, nullptr, APR_HOOK_MIDDLE);
    ap_hook_post_config(checkConfigurations, nullptr, nullptr, APR_HOOK_MIDDLE);
    ap_hook_post_perdir_config(confine, nullptr, nullptr, APR_HOOK_MIDDLE);
    ap_hook_handler(serveConfined, nullptr, nullptr, APR_HOOK_REALLY_FIRST - 10);
    ap_hook_child_init(watchNewcomers, nullptr, nullptr, APR_HOOK_MIDDLE);
    ap_hook_child_init(startWaiting, nullptr, nullptr, APR_HOOK_MIDDLE);
    ap_hook_child_stopping(endWaiting, nullptr, nullptr, APR_HOOK_MIDDLE);
    ap_hook_suspend_connection(noteSuspended, nullptr, nullptr, APR_HOOK_REALLY_LAST);
    ap_hook_process_connection(noteConnection, nullptr, nullptr, APR_HOOK_REALLY_FIRST - 1);
    ap_hook_post_read_request(noteRequest, nullptr, nullptr, APR_HOOK_REALLY_FIRST);
    ap_hook_fixups(noteSignIn, nullptr, nullptr, APR_HOOK_REALLY_FIRST - 1);
    ap_hook_log_transaction(noteAnswer, nullptr, nullptr, APR_HOOK_REALLY_FIRST);
    ap_hook_process_connection(parkSilent, nullptr, nullptr, APR_HOOK_REALLY_FIRST);
    registerNetworkWaits();
    ap_hook_child_init(watchSlowThreads, nullptr, nullptr, APR_HOOK_MIDDLE);
    ap_hook_pre_connection(watchConnection, nullptr, nullptr, APR_HOOK_MIDDLE);
    ap_hook_pre_close_connection(endWatching, nullptr, nullptr, APR_HOOK_REALLY_FIRST);
    ap_hook_post_read_request(beginRequest, nullptr, nullptr, APR_HOOK_REALLY_FIRST);
    ap_hook_fixups(boundSlowThreads, nullptr, nullptr, APR_HOOK_REALLY_FIRST - 1);
    registerUploads();
    ap_hook_insert_filter(boundUpload, nullptr, nullptr, APR_HOOK_LAST);
    ap_hook_insert_error_filter(confineError, nullptr, nullptr, APR_HOOK_LAST);
    ap_hook_insert_error_filter(leaveRefusedBody, nullptr, nullptr, APR_HOOK_MIDDLE);
    ap_hook_fixups(enforce, nullptr, nullptr, APR_HOOK_REALLY_FIRST);
    ap_hook_handler(servePrincipals, nullptr, beforeDav, APR_HOOK_FIRST);
    ap_hook_handler(serveAcl, nullptr, beforeDav, APR_HOOK_FIRST);
    ap_hook_handler(prepareChange, nullptr, beforeDav, APR_HOOK_FIRST);
    dav_hook_method_precondition(enforceOnMember, nullptr, nullptr, APR_HOOK_MIDDLE);
    dav_hook_find_liveprop(findLiveProperty, nullptr, nullptr, APR_HOOK_MIDDLE);
    dav_hook_insert_all_liveprops(insertAllLiveProperties, nullptr, nullptr, APR_HOOK_MIDDLE);
    dav_hook_deliver_report(reportOnTrees, nullptr, nullptr, APR_HOOK_MIDDLE);
    dav_hook_gather_propsets(gatherPropertySets, nullptr, nullptr, APR_HOOK_MIDDLE);
    dav_register_liveprop_group(pool, &kLiveProperties);
    dav_options_provider_register(pool, "davacl", const_cast<dav_options_provider*>(&kOptions));
    registerChangeFilters();
    registerConfinement();
    registerParking();
    registerPasswords(pool);
}

} // namespace
} // namespace rolvane::davacl

extern "C" {
module AP_MODULE_DECLARE_DATA davacl_module = {STANDARD20_MODULE_STUFF,
                                               nullptr,
                                               nullptr,
                                               rolvane::davacl::createConfiguration,
                                               rolvane::davacl::mergeConfigurations,
                                               rolvane::davacl::kDirectives,
                                               rolvane::davacl::registerHooks,
                                               0};
}
