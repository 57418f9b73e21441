#include "server/mod_cardbook/Configuration.h"

#include <string_view>

namespace rolvane::cardbook {
namespace {

Configuration& of(cmd_parms* parms) {
    return *static_cast<Configuration*>(ap_get_module_config(parms->server->module_config, &cardbook_module));
}

const char* setDatabase(cmd_parms* parms, void*, const char* path) noexcept {
    if (*path != '/') return "CardBookDatabase wants the whole path of a contact database";
    of(parms).database = path;
    return nullptr;
}

const char* setBytes(cmd_parms* parms, void*, const char* text) noexcept {
    apr_off_t bytes = 0;
    char* end = nullptr;
    if (apr_strtoff(&bytes, text, &end, 10) != APR_SUCCESS || *end || bytes < 1)
        return apr_pstrcat(parms->pool, parms->cmd->name, " wants a number of bytes above 0", nullptr);
    (parms->info ? of(parms).maxCard : of(parms).maxReport) = bytes;
    return nullptr;
}

template <class Function>
cmd_func asDirective(Function function) {
    return reinterpret_cast<cmd_func>(reinterpret_cast<void*>(function));
}

char kCard; // tells the two numbers apart

} // namespace

const Configuration& configurationOf(const request_rec* r) {
    return *static_cast<const Configuration*>(ap_get_module_config(r->server->module_config, &cardbook_module));
}

bool servesBooks(request_rec* r) {
    const char* provider = dav_get_provider_name(r);
    return provider && std::string_view(provider) == "cardbook";
}

void* createConfiguration(apr_pool_t* pool, server_rec*) {
    return new (apr_palloc(pool, sizeof(Configuration))) Configuration();
}

void* mergeConfigurations(apr_pool_t* pool, void* base, void* more) {
    const auto& outer = *static_cast<const Configuration*>(base);
    auto* merged =
        new (apr_palloc(pool, sizeof(Configuration))) Configuration(*static_cast<const Configuration*>(more));
    if (!merged->database) merged->database = outer.database;
    if (!merged->maxCard) merged->maxCard = outer.maxCard;
    if (!merged->maxReport) merged->maxReport = outer.maxReport;
    return merged;
}

const command_rec kDirectives[] = {
    AP_INIT_TAKE1("CardBookDatabase", asDirective(setDatabase), nullptr, RSRC_CONF, "the file of the contact database"),
    AP_INIT_TAKE1("CardBookMaxCard", asDirective(setBytes), &kCard, RSRC_CONF, "the most bytes of a card"),
    AP_INIT_TAKE1("CardBookMaxReport", asDirective(setBytes), nullptr, RSRC_CONF,
                  "the most bytes of a request's body that is no card"),
    {}};

} // namespace rolvane::cardbook
