#include "server/mod_davacl/Confinement.h"

#include "server/mod_davacl/Access.h"
#include "server/mod_davacl/AclMethod.h"
#include "server/mod_davacl/Changes.h"
#include "server/mod_davacl/Index.h"
#include "server/mod_davacl/PrincipalResources.h"
#include "server/mod_davacl/TreeDirectories.h"
#include "server/mod_davacl/WaitingRequests.h"

#include <algorithm>
#include <cstring>
#include <iterator>
#include <sstream>
#include <string>

namespace rolvane::davacl {
namespace {

constexpr const char* kPrivate = "davacl_private";

struct Setting {
    const char* module; // the settings of one that is not loaded are left out
    const char* lines;
};

// All of them send a request elsewhere than to the resource that it names. The first makes sure that httpd's own
// settings are copied and can be changed.
constexpr Setting kSettings[] = {
    {"core.c", "Options None\n"},
    {"mod_dir.c", "DirectoryIndex disabled\nDirectorySlash Off\nFallbackResource disabled\n"},
    {"mod_speling.c", "CheckSpelling Off\n"},
    {"mod_rewrite.c", "RewriteEngine Off\n"},
    {"mod_include.c", "XBitHack Off\n"},
};

// A configuration file that is a text.
apr_status_t readLine(void* buffer, apr_size_t size, void* text) noexcept {
    auto* stream = static_cast<std::istringstream*>(text);
    std::string line;
    if (size < 2 || !std::getline(*stream, line)) return APR_EOF;
    apr_cpystrn(static_cast<char*>(buffer), (line + "\n").c_str(), size);
    return APR_SUCCESS;
}

apr_status_t readCharacter(char* into, void* text) noexcept {
    return static_cast<std::istringstream*>(text)->get(*into) ? APR_SUCCESS : APR_EOF;
}

apr_status_t closeText(void*) noexcept {
    return APR_SUCCESS;
}

ap_conf_vector_t* settings = nullptr; // of the configuration in force; in its pool

bool isConfined(const request_rec* r, const Configuration& c) {
    return TreePath::of(c.base, r->uri) || TreePath::of(c.principalBase(), r->uri);
}

ap_conf_vector_t* withSettings(const request_rec* r, apr_pool_t* pool) {
    ap_conf_vector_t* made = ap_merge_per_dir_configs(pool, r->per_dir_config, settings);
    auto* core = static_cast<core_dir_config*>(ap_get_core_module_config(made));
    core->handler = nullptr;
    core->expr_handler = nullptr;
    core->input_filters = nullptr;
    core->output_filters = nullptr;
    core->response_code_exprs = nullptr;
    core->response_code_strings = nullptr;
    return made;
}

// Whether a filter between the files and the connection may stay.
bool mayFilter(const request_rec* r, const ap_filter_t* filter) {
    static constexpr const char* kHarmless[] = {"subreq_core", "fixup_headers_out", "fixup_headers_err", "mod_expires"};
    static constexpr const char* kCompression[] = {"deflate", "brotli_compress", "bytype:deflate",
                                                   "bytype:brotli_compress"};
    const char* name = filter->frec->name;
    const auto isName = [&](const char* known) { return strcasecmp(known, name) == 0; };
    if (filter->r != r || filter->frec->ftype >= AP_FTYPE_PROTOCOL || strncasecmp(name, "davacl", 6) == 0 ||
        std::any_of(std::begin(kHarmless), std::end(kHarmless), isName))
        return true;
    // A file's entity tag is that of its bytes: compressed it would get another one, which nobody takes back.
    const bool isListing = std::strcmp(r->method, "PROPFIND") == 0 || std::strcmp(r->method, "REPORT") == 0;
    return isListing && std::any_of(std::begin(kCompression), std::end(kCompression), isName);
}

void removeForeignFilters(request_rec* r) {
    for (ap_filter_t* filter = r->output_filters; filter;) {
        ap_filter_t* next = filter->next;
        if (!mayFilter(r, filter)) ap_remove_output_filter(filter);
        filter = next;
    }
    for (ap_filter_t* filter = r->input_filters; filter;) {
        ap_filter_t* next = filter->next;
        if (!mayFilter(r, filter)) ap_remove_input_filter(filter);
        filter = next;
    }
}

// A cache looks at neither lists nor passwords, whoever runs it: this httpd, a proxy in front of it, or one in between.
// Headers that the server sets for all its pages may say otherwise, so the last word is here.
apr_status_t keepPrivate(ap_filter_t* filter, apr_bucket_brigade* brigade) noexcept {
    request_rec* r = filter->r;
    ap_filter_t* next = filter->next;
    for (apr_table_t* headers : {r->headers_out, r->err_headers_out})
        for (const char* name : {"Cache-Control", "Expires", "Surrogate-Control", "CDN-Cache-Control"})
            apr_table_unset(headers, name);
    apr_table_setn(r->headers_out, "Cache-Control", "private, no-cache");
    r->no_cache = 0; // for the caches of this httpd, which have seen it; the header says it now
    ap_remove_output_filter(filter);
    return ap_pass_brigade(next, brigade);
}

void keepFromCaches(request_rec* r) {
    for (const ap_filter_t* each = r->output_filters; each; each = each->next)
        if (strcasecmp(each->frec->name, kPrivate) == 0) return;
    r->no_cache = 1;
    ap_add_output_filter(kPrivate, nullptr, r, r->connection);
}

// As mod_dav decides it itself; another module may have changed its mind since.
const char* handlerFor(request_rec* r) {
    const dav_provider* provider = dav_get_provider(r);
    const bool isSent =
        r->method_number == M_POST || (r->method_number == M_GET && provider && !provider->repos->handle_get);
    return provider && !isSent ? "dav-handler" : "default-handler";
}

// The handlers that a module has registered, in their order.
int handOver(request_rec* r, const char* module) {
    const apr_array_header_t* hooks = ap_hook_get_handler();
    for (int i = 0; hooks && i < hooks->nelts; ++i) {
        const auto& hook = reinterpret_cast<const ap_LINK_handler_t*>(hooks->elts)[i];
        if (!hook.szName || std::strcmp(hook.szName, module) != 0) continue;
        if (const int answer = hook.pFunc(r); answer != DECLINED) return answer;
    }
    return DECLINED;
}

int serve(request_rec* r) {
    const Configuration* c = configurationOf(r);
    if (!c || !isConfined(r, *c)) return DECLINED;
    if (r->proxyreq != PROXYREQ_NONE) {
        ap_log_rerror(APLOG_MARK, APLOG_ERR, 0, r, "davacl: %s is in a tree, and is sent to a proxy: refused", r->uri);
        return HTTP_FORBIDDEN;
    }
    removeForeignFilters(r);
    r->handler = handlerFor(r);
    // A writer of a tree does not run the site, so a browser treats an uploaded page as foreign to it.
    apr_table_setn(r->headers_out, "Content-Security-Policy", "sandbox; default-src 'none'");
    apr_table_setn(r->headers_out, "X-Content-Type-Options", "nosniff");
    for (const auto own : {servePrincipals, serveAcl, serveIndex, prepareChange})
        if (const int answer = own(r); answer != DECLINED) return answer;
    for (const char* module : {"mod_dav.c", "core.c"})
        if (const int answer = handOver(r, module); answer != DECLINED) return handedOver(r, answer);
    return HTTP_NOT_FOUND;
}

} // namespace

const char* prepareConfinement(apr_pool_t* pool, apr_pool_t* temporary, server_rec* server) {
    std::string lines;
    for (const Setting& each : kSettings)
        if (ap_find_linked_module(each.module)) lines += each.lines;
    std::istringstream text(lines);
    settings = ap_create_per_dir_config(pool);
    cmd_parms parameters{};
    parameters.pool = pool;
    parameters.temp_pool = temporary;
    parameters.server = server;
    parameters.override = RSRC_CONF | OR_ALL | ACCESS_CONF;
    parameters.override_opts = OPT_ALL | OPT_SYM_OWNER | OPT_MULTI;
    parameters.limited = -1;
    parameters.path = apr_pstrdup(pool, "/");
    parameters.context = settings;
    parameters.config_file = ap_pcfg_open_custom(pool, "mod_davacl", &text, readCharacter, readLine, closeText);
    ap_directive_t* tree = nullptr;
    const char* complaint = ap_build_config(&parameters, pool, temporary, &tree);
    return complaint ? complaint : ap_walk_config(tree, &parameters, settings);
}

int confine(request_rec* r) noexcept {
    return contained(r, static_cast<int>(HTTP_INTERNAL_SERVER_ERROR), [r]() -> int {
        const Configuration* c = configurationOf(r);
        if (!c || !isConfined(r, *c)) return isOfATree(r) ? static_cast<int>(HTTP_FORBIDDEN) : DECLINED;
        if (!r->main) keepFromCaches(r);
        learnDirectory(r, *c);
        // Sub-requests with the same settings keep having the same ones: httpd need not ask for the password again.
        auto& known = stateOf(r).confined;
        if (std::any_of(known.begin(), known.end(), [&](const auto& each) { return each.second == r->per_dir_config; }))
            return DECLINED;
        request_rec* top = r;
        while (top->main) top = top->main;
        auto& mine = known[r->per_dir_config];
        if (!mine) mine = withSettings(r, top->pool);
        r->per_dir_config = mine;
        return DECLINED;
    });
}

void registerConfinement() noexcept {
    // Behind the filters of caches and headers, before the one that writes the head of the answer.
    ap_register_output_filter(kPrivate, keepPrivate, nullptr, static_cast<ap_filter_type>(AP_FTYPE_PROTOCOL - 1));
}

void confineError(request_rec* r) noexcept {
    contained(r, false, [r] {
        const Configuration* c = configurationOf(r);
        if (c && isConfined(r, *c)) keepFromCaches(r);
        return true;
    });
}

int serveConfined(request_rec* r) noexcept {
    return contained(r, static_cast<int>(HTTP_INTERNAL_SERVER_ERROR), [r] { return serve(r); });
}

} // namespace rolvane::davacl
