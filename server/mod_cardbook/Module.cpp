// mod_cardbook: the address books of a contact database as CardDAV collections (RFC 6352), a provider of mod_dav. Load
// it after mod_dav.

#include "server/mod_cardbook/Configuration.h"
#include "server/mod_cardbook/Properties.h"
#include "server/mod_cardbook/Reports.h"
#include "server/mod_cardbook/Repository.h"
#include "server/mod_cardbook/Resource.h"
#include "server/mod_cardbook/Writing.h"

namespace rolvane::cardbook {
namespace {

dav_error* namesOfMethods(request_rec*, const dav_resource* resource, apr_text_header* names) noexcept {
    if (isOurs(resource)) apr_text_append(resource->pool, names, "3, access-control, addressbook");
    return nullptr;
}

dav_error* addMethods(request_rec*, const dav_resource* resource, apr_text_header* methods) noexcept {
    if (isOurs(resource) && resource->collection) apr_text_append(resource->pool, methods, "REPORT");
    return nullptr;
}

const dav_options_provider kOptions = {namesOfMethods, addMethods, nullptr};
const dav_resource_type_provider kTypes = {resourceType};

// A body that is no card is read whole by httpd, which asks its own limit (LimitXMLRequestBody).
int boundBodies(request_rec* r) noexcept {
    if (!servesBooks(r)) return DECLINED;
    // mod_dav has the provider read and compare lock tokens without asking whether it has locks: a worker would end
    // there. Conditions on tags stand in If-Match.
    if (apr_table_get(r->headers_in, "If")) return HTTP_PRECONDITION_FAILED;
    auto* core = static_cast<core_dir_config*>(ap_get_core_module_config(r->per_dir_config));
    core->limit_xml_body = configurationOf(r).reportBytes();
    return DECLINED;
}

void registerHooks(apr_pool_t* pool) noexcept {
    dav_register_provider(pool, "cardbook", &kProvider);
    dav_register_liveprop_group(pool, &kLiveProperties);
    dav_hook_find_liveprop(findLiveProperty, nullptr, nullptr, APR_HOOK_FIRST);
    dav_hook_insert_all_liveprops(insertAllLiveProperties, nullptr, nullptr, APR_HOOK_MIDDLE);
    dav_hook_method_precondition(prepareMethod, nullptr, nullptr, APR_HOOK_MIDDLE);
    dav_hook_deliver_report(deliverReport, nullptr, nullptr, APR_HOOK_MIDDLE);
    // No gather_reports: httpd 2.4.71 makes the array for pointers but reads larger structures out of it, and a
    // provider with more than one report ends the worker. DAV:supported-report-set is a live property here.
    dav_resource_type_provider_register(pool, "cardbook", const_cast<dav_resource_type_provider*>(&kTypes));
    dav_options_provider_register(pool, "cardbook", const_cast<dav_options_provider*>(&kOptions));
    ap_hook_fixups(boundBodies, nullptr, nullptr, APR_HOOK_MIDDLE);
}

} // namespace
} // namespace rolvane::cardbook

extern "C" {
module AP_MODULE_DECLARE_DATA cardbook_module = {STANDARD20_MODULE_STUFF,
                                                 nullptr,
                                                 nullptr,
                                                 rolvane::cardbook::createConfiguration,
                                                 rolvane::cardbook::mergeConfigurations,
                                                 rolvane::cardbook::kDirectives,
                                                 rolvane::cardbook::registerHooks,
                                                 0};
}
