#include "server/mod_davacl/News.h"

#include "server/mod_davacl/Access.h"

#include <algorithm>
#include <ap_mpm.h>
#include <string>

namespace rolvane::davacl {
namespace {

// The name says how the ring's memory is laid out: another version of the module makes its own.
constexpr const char* kRetained = "davacl-news-2";
constexpr const char* kClockFile = "dateFile";

struct Retained {
    NewsRing* ring;
};
NewsRing* ring = nullptr; // of the process, over restarts

// Written by every pass of the tree's owner: it tells the store's time, and nothing that others read.
bool isClockFile(const TreePath& place) {
    return !place.below.empty() && place.below.back() == kClockFile;
}

bool mpmSuspends() {
    int async = 0;
    return ap_mpm_query(AP_MPMQ_IS_ASYNC, &async) == APR_SUCCESS && async;
}

} // namespace

NewsRing* newsRing() {
    return ring;
}

const char* prepareNews(server_rec* main) {
    bool wanted = false;
    for (const server_rec* each = main; each; each = each->next) wanted = wanted || givesNews(each);
    if (!wanted) return nullptr;
    auto* kept = static_cast<Retained*>(ap_retained_data_get(kRetained));
    if (!kept) {
        kept = static_cast<Retained*>(ap_retained_data_create(kRetained, sizeof(Retained)));
        kept->ring = NewsRing::map();
    }
    ring = kept->ring;
    return ring ? nullptr : "there is no memory, or no random number, to tell news with";
}

void noteChange(const request_rec* r, const Configuration& c, const TreePath& place) {
    if (!ring || !givesNews(r->server) || isClockFile(place)) return;
    const char* given = apr_table_get(r->headers_in, kWriterHeader);
    const uint64_t writer = given && *given && r->user ? NewsRing::numberOf(std::string(r->user) + "\n" + given) : 0;
    for (size_t levels = 1; levels <= std::min(place.levels(), c.levels()); ++levels)
        ring->post({NewsRing::numberOf(place.owner + "/" + place.tree(levels - 1)), writer});
}

bool tellsNews(const request_rec* r) {
    return ring && givesNews(r->server) && mpmSuspends();
}

void announceNews(request_rec* r) {
    const Configuration* c = configurationOf(r);
    if (!c || !tellsNews(r)) return;
    const std::string value =
        std::string(ap_os_escape_path(r->pool, c->base, 1)) + "/ " + ring->token(ring->position());
    apr_table_setn(r->headers_out, kNewsHeader, apr_pstrdup(r->pool, value.c_str()));
}

} // namespace rolvane::davacl
