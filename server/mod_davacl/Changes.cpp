#include "server/mod_davacl/Changes.h"

#include "server/mod_davacl/Access.h"
#include "server/mod_davacl/News.h"
#include "server/mod_davacl/QuotaTurn.h"

#include <cerrno>
#include <cstring>
#include <memory>
#include <new>

namespace rolvane::davacl {
namespace {

constexpr const char* kLastByte = "DAVACL-LAST-BYTE";
constexpr const char* kAnswer = "DAVACL-ANSWER";

// One change under way; in the request's pool, with a clean-up.
struct Change {
    const Configuration* c = nullptr;
    std::optional<TreePath> source, destination; // each only when it is below the base
    std::vector<Need> sourceNeeds, destinationNeeds;
    std::optional<QuotaTurn::Place> destinationOnDisk;
    std::unique_ptr<QuotaTurn> quota; // null until the handler may begin
    uint64_t received = 0;            // bytes of the body so far
};

apr_status_t destroyChange(void* change) {
    static_cast<Change*>(change)->~Change();
    return APR_SUCCESS;
}

Change* makeChange(request_rec* r) {
    auto* change = new (apr_palloc(r->pool, sizeof(Change))) Change;
    apr_pool_cleanup_register(r->pool, change, destroyChange, apr_pool_cleanup_null);
    return change;
}

bool is(const request_rec* r, const char* method) {
    return std::strcmp(r->method, method) == 0;
}

// httpd's page for the status with these words in it.
int badRequest(request_rec* r, const char* words) {
    apr_table_setn(r->notes, "error-notes", words);
    apr_table_setn(r->notes, "verbose-error-to", "*");
    return HTTP_BAD_REQUEST;
}

bool mayHaveList(const Change& change, const TreePath& place) {
    return !place.isBase() && place.levels() <= change.c->levels();
}

// Changes the lists of an owner; nothing is written when `change` changes nothing.
template <class Edit>
void edit(request_rec* r, const Configuration& c, const std::string& owner, Edit change) {
    const ListStore store(c.lists);
    if (const auto seen = store.read(owner); seen && seen->empty()) return;
    const auto guard = store.guard(owner, ListStore::Hold::exclusive);
    auto lists = guard ? store.read(owner) : std::nullopt;
    if (lists) {
        const OwnersLists before = *lists;
        change(*lists);
        if (*lists == before || store.write(owner, *lists)) return;
    }
    ap_log_rerror(APLOG_MARK, APLOG_ERR, errno, r, "davacl: the lists below %s could not be cleaned up (%s)", r->uri,
                  store.pathFor(owner).c_str());
}

void dropLists(request_rec* r, const Change& change, const TreePath& place) {
    if (mayHaveList(change, place))
        edit(r, *change.c, place.owner, [&](OwnersLists& lists) { lists.drop(place.tree()); });
}

bool stands(request_rec* r) {
    dav_resource* resource = nullptr;
    return dav_get_resource(r, 0, 0, &resource) != nullptr || resource->exists;
}

// The lists that the change relies on are held; the reason why it may not go on any more.
std::optional<Missing> hold(request_rec* r, const Change& change) {
    RequestState& state = stateOf(r);
    const ListStore store(change.c->lists);
    std::map<std::string, TreePath> owners; // each once and in one order for everybody: nobody waits in a circle
    for (const auto* place : {&change.source, &change.destination})
        if (*place && !(*place)->isBase() && (*place)->owner != r->user) owners.try_emplace((*place)->owner, **place);
    for (const auto& [owner, place] : owners) {
        state.guards.push_back(store.guard(owner, ListStore::Hold::shared));
        if (!state.guards.back()) return Missing{place, kWriteContent};
    }
    if (state.guards.empty()) return std::nullopt; // the owner's right does not come from a list
    state.forgetLists();
    auto missing = change.source ? missingOf(r, *change.c, *change.source, change.sourceNeeds) : std::nullopt;
    if (!missing && change.source) missing = missingWithin(r, *change.c, *change.source);
    if (!missing && change.destination) missing = missingOf(r, *change.c, *change.destination, change.destinationNeeds);
    if (missing) state.guards.clear();
    return missing;
}

bool endsHere(apr_bucket_brigade* brigade) {
    for (apr_bucket* b = APR_BRIGADE_FIRST(brigade); b != APR_BRIGADE_SENTINEL(brigade); b = APR_BUCKET_NEXT(b))
        if (APR_BUCKET_IS_EOS(b)) return true;
    return false;
}

// An error bucket makes httpd answer with the status, whatever the handler that was reading makes of it.
apr_status_t stopReading(ap_filter_t* filter, int status) {
    request_rec* r = filter->r;
    apr_bucket_alloc_t* allocator = r->connection->bucket_alloc;
    apr_bucket_brigade* brigade = apr_brigade_create(r->pool, allocator);
    APR_BRIGADE_INSERT_TAIL(brigade, ap_bucket_error_create(status, nullptr, r->pool, allocator));
    APR_BRIGADE_INSERT_TAIL(brigade, apr_bucket_eos_create(allocator));
    ap_remove_input_filter(filter);
    ap_pass_brigade(r->output_filters, brigade);
    return AP_FILTER_ERROR;
}

apr_status_t readLastByte(ap_filter_t* filter, apr_bucket_brigade* brigade, ap_input_mode_t mode, apr_read_type_e block,
                          apr_off_t wanted) noexcept {
    const apr_status_t status = ap_get_brigade(filter->next, brigade, mode, block, wanted);
    if (status != APR_SUCCESS || mode != AP_MODE_READBYTES) return status;
    auto& change = *static_cast<Change*>(filter->ctx);
    apr_off_t bytes = 0;
    if (apr_brigade_length(brigade, 1, &bytes) == APR_SUCCESS && bytes > 0)
        change.received += static_cast<uint64_t>(bytes);
    if (!endsHere(brigade)) {
        if (change.quota->allows(change.received)) return status;
        apr_brigade_cleanup(brigade);
        filter->r->connection->keepalive = AP_CONN_CLOSE; // the rest of the body is not read
        return stopReading(filter, HTTP_INSUFFICIENT_STORAGE);
    }
    return contained(filter->r, static_cast<apr_status_t>(APR_EGENERAL), [&]() -> apr_status_t {
        const bool refused = hold(filter->r, change).has_value();
        if (!refused && change.quota->begin(change.received)) {
            ap_remove_input_filter(filter);
            return APR_SUCCESS;
        }
        stateOf(filter->r).guards.clear();
        apr_brigade_cleanup(brigade);
        return stopReading(filter, refused ? HTTP_FORBIDDEN : HTTP_INSUFFICIENT_STORAGE);
    });
}

void follow(request_rec* r, const Change& change) {
    if (is(r, "DELETE") && change.source) dropLists(r, change, *change.source);
    if (change.destination && !is(r, "MOVE")) dropLists(r, change, *change.destination);
    if (!is(r, "MOVE")) return;
    if (change.source && change.destination && change.source->owner == change.destination->owner)
        return edit(r, *change.c, change.source->owner, [&](OwnersLists& lists) {
            lists.drop(change.destination->tree());
            lists.move(change.source->tree(), change.destination->tree());
        });
    if (change.destination) dropLists(r, change, *change.destination);
    if (change.source) dropLists(r, change, *change.source);
}

void tellNews(const request_rec* r, const Change& change) {
    if (change.source && !is(r, "COPY")) noteChange(r, *change.c, *change.source);
    if (change.destination) noteChange(r, *change.c, *change.destination);
}

apr_status_t beforeAnswer(ap_filter_t* filter, apr_bucket_brigade* brigade) noexcept {
    request_rec* r = filter->r;
    ap_filter_t* next = filter->next;
    contained(r, false, [&] {
        auto& change = *static_cast<Change*>(filter->ctx);
        change.quota->end();
        stateOf(r).guards.clear();
        // 207: something was left, and the place with it.
        const bool done = r->status >= 200 && r->status < 300;
        if (done && r->status != HTTP_MULTI_STATUS) follow(r, change);
        // A LOCK is no news, but for one that has made a file.
        if (done && (!is(r, "LOCK") || r->status == HTTP_CREATED)) tellNews(r, change);
        return true;
    });
    ap_remove_output_filter(filter);
    return ap_pass_brigade(next, brigade);
}

// A list cannot go to another owner, nor below where lists are.
bool carriesListAway(request_rec* r, const Change& change) {
    if (!is(r, "MOVE") || !change.source || !mayHaveList(change, *change.source)) return false;
    const auto lists = ListStore(change.c->lists).read(change.source->owner);
    if (lists && !lists->has(change.source->tree())) return false;
    return !change.destination || change.destination->owner != change.source->owner ||
           change.destination->levels() != change.source->levels();
}

// OK when the Destination may be written, or is not ours to judge; else what the handler returns.
int lookAtDestination(request_rec* r, Change& change) {
    const char* text = apr_table_get(r->headers_in, "Destination");
    // mod_dav takes an old name of the header, too, and makes a URL of it in a way of its own.
    if (!text && apr_table_get(r->headers_in, "New-uri"))
        return badRequest(r, "New-uri is not supported here. Send a Destination.");
    if (!text) return OK;
    const dav_lookup_result found = dav_lookup_uri(text, r, 0);
    if (!found.rnew) return OK; // mod_dav says what is wrong with it
    if (found.rnew->status != HTTP_OK) {
        const auto& lacks = stateOf(r).destinationLacks;
        return lacks ? refuse(r, *change.c, *lacks) : OK;
    }
    change.destination = TreePath::of(change.c->base, found.rnew->uri);
    change.destinationNeeds = needsOfDestination(r->method, standingOf(found.rnew));
    change.destinationOnDisk = quotaPlaceOf(found.rnew, change.destination);
    // mod_dav would remove what is there first, and the source with it.
    if (change.source && change.destination && change.source->isWithin(*change.destination))
        return dav_handle_err(
            r, dav_new_error(r->pool, HTTP_FORBIDDEN, 0, 0, "The Destination holds what would be copied."), nullptr);
    if (carriesListAway(r, change))
        return dav_handle_err(r,
                              dav_new_error(r->pool, HTTP_FORBIDDEN, 0, 0,
                                            "The collection has access lists, which cannot go along. Take them away "
                                            "first."),
                              nullptr);
    if (change.destination && !stands(found.rnew)) dropLists(r, change, *change.destination);
    return OK;
}

int prepare(request_rec* r) {
    const Configuration* c = configurationOf(r);
    if (!c || r->main || !r->handler || std::strcmp(r->handler, "dav-handler") != 0 ||
        (!changesSomething(r->method) && !is(r, "LOCK")))
        return DECLINED;
    Change* change = makeChange(r);
    change->c = c;
    change->source = TreePath::of(c->base, r->uri);
    change->sourceNeeds = needsOf(r->method, standingOf(r));
    if (is(r, "COPY") || is(r, "MOVE"))
        if (const int answer = lookAtDestination(r, *change); answer != OK) return answer;
    if (!change->source && !change->destination) return DECLINED;
    // mod_dav writes a part into the file where it stands, long before the last byte of the request is here (RFC 9110
    // section 14.5 lets a server refuse it).
    if (is(r, "PUT") && apr_table_get(r->headers_in, "Content-Range"))
        return badRequest(r, "PUT with Content-Range is not supported here. Send the whole file.");
    change->quota =
        std::make_unique<QuotaTurn>(r, *c, quotaPlaceOf(r, change->source), std::move(change->destinationOnDisk));
    if (!change->quota->mayBegin()) return refuseForRoom(r);
    if (is(r, "MKCOL") && !stands(r)) dropLists(r, *change, *change->source);
    ap_add_output_filter(kAnswer, change, r, r->connection);
    if (ap_request_has_body(r)) {
        ap_add_input_filter(kLastByte, change, r, r->connection);
        return DECLINED;
    }
    if (const auto missing = hold(r, *change)) return refuse(r, *c, *missing);
    if (change->quota->begin(0)) return DECLINED;
    stateOf(r).guards.clear();
    return refuseForRoom(r);
}

} // namespace

int prepareChange(request_rec* r) noexcept {
    return contained(r, static_cast<int>(HTTP_INTERNAL_SERVER_ERROR), [r] { return prepare(r); });
}

void registerChangeFilters() {
    ap_register_input_filter(kLastByte, readLastByte, nullptr, AP_FTYPE_CONTENT_SET);
    // A protocol filter: it stays when httpd throws the others away to send an error or an empty answer.
    ap_register_output_filter(kAnswer, beforeAnswer, nullptr, AP_FTYPE_PROTOCOL);
}

} // namespace rolvane::davacl
