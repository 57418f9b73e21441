#include "server/mod_cardbook/Repository.h"

#include "contacts/vcard/VCardText.h"
#include "server/mod_cardbook/Devices.h"
#include "server/mod_cardbook/Resource.h"
#include "server/mod_cardbook/Writing.h"

#include <algorithm>
#include <string_view>

namespace rolvane::cardbook {
namespace {

Resource resourceAt(request_rec* r, const std::string& base, const Place& place) {
    Resource it;
    it.r = r;
    it.library = &libraryOf(r);
    it.base = base;
    it.place = place;
    if (place.kind != Place::Kind::book && place.kind != Place::Kind::card) return it;
    if (auto book = it.library->book(place.book)) it.book = std::make_shared<const Book>(std::move(*book));
    if (it.book && place.kind == Place::Kind::card) it.member = it.library->memory().named(place.book, place.name);
    return it;
}

// A device that asks for a card that has left its book is going to be told so.
void noteAskedInVain(const Resource& it) {
    if (it.r->method_number != M_GET || it.place.kind != Place::Kind::card || !it.book || it.member) return;
    BookMemory& memory = it.library->memory();
    if (const auto left = memory.departed(it.place.book, it.place.name))
        Devices(memory).noteTold(it.r->user, it.place.book, *left);
}

dav_error* getResource(request_rec* r, const char* root, const char*, int, dav_resource** resource) noexcept {
    return contained(r, [&] {
        std::string base = root ? root : "";
        while (base.ends_with('/')) base.pop_back();
        const auto place = placeOf(base, r->uri);
        *resource = newResource(r->pool, resourceAt(r, base, place.value_or(Place{})));
        contained(r, [&] { noteAskedInVain(of(*resource)); });
    });
}

dav_error* getParent(const dav_resource* resource, dav_resource** parent) noexcept {
    *parent = nullptr;
    return contained(of(resource).r, [&] {
        const Resource& it = of(resource);
        Place above;
        switch (it.place.kind) {
        case Place::Kind::card: above = {Place::Kind::book, it.place.book, {}}; break;
        case Place::Kind::book: above.kind = Place::Kind::home; break;
        case Place::Kind::root: return;
        case Place::Kind::nowhere: break; // below nothing
        default: above.kind = Place::Kind::root;
        }
        *parent = newResource(resource->pool, resourceAt(it.r, it.base, above));
    });
}

int isSame(const dav_resource* a, const dav_resource* b) noexcept {
    return isOurs(a) && isOurs(b) && std::string_view(a->uri) == b->uri;
}

int isParent(const dav_resource* a, const dav_resource* b) noexcept {
    const std::string_view above(a->uri), below(b->uri);
    return isOurs(a) && isOurs(b) && above.ends_with('/') && below.starts_with(above) && below.size() > above.size();
}

const char* entityTag(const dav_resource* resource) noexcept {
    const Resource& it = of(resource);
    if (!it.member) return nullptr;
    return apr_pstrdup(resource->pool,
                       (it.card ? it.card->tag : Library::tagOf(it.member->uid, it.member->modified)).c_str());
}

request_rec* requestOf(const dav_resource* resource) noexcept {
    return of(resource).r;
}

const char* noPath(const dav_resource*) noexcept {
    return nullptr;
}

// Reading ----------------------------------------------------------------------------------------------------------

// Which version an Accept header wants; nothing: whichever there is. A header that leaves neither version is refused
// (RFC 6352 section 5.1.1.1). Of several the first one counts: address books name one.
std::optional<VCardVersion> acceptedVersion(const request_rec* r) {
    const char* accept = apr_table_get(r->headers_in, "Accept");
    if (!accept || !*accept) return std::nullopt;
    const std::string text = vcardLower(accept);
    for (size_t at = 0; at < text.size();) {
        const size_t end = std::min(text.find(',', at), text.size());
        std::string range = text.substr(at, end - at);
        at = end + 1;
        std::erase_if(range, [](char c) { return c == ' ' || c == '\t' || c == '"'; });
        const std::string type = range.substr(0, range.find(';'));
        if (type == "*/*" || type == "text/*") return std::nullopt;
        if (type != "text/vcard" && type != "text/x-vcard" && type != "text/directory") continue;
        const size_t version = range.find(";version=");
        if (version == std::string::npos) return std::nullopt;
        const std::string_view number = std::string_view(range).substr(version + std::string_view(";version=").size());
        if (number.starts_with("4")) return VCardVersion::v4;
        if (number.starts_with("3")) return VCardVersion::v3;
    }
    throw Refused(HTTP_NOT_ACCEPTABLE, kCardSpace, "supported-address-data-conversion",
                  "Cards are text/vcard of version 3.0 or 4.0.");
}

dav_error* setHeaders(request_rec* r, const dav_resource* resource) noexcept {
    return contained(r, [&] {
        Resource& it = of(resource);
        if (it.place.kind != Place::Kind::card) return ap_set_content_type(r, "text/html; charset=utf-8");
        if (!it.member) return;
        it.card = it.library->card(*it.member, acceptedVersion(r));
        if (!it.card) throw Refused(HTTP_NOT_FOUND, "The card has just gone.");
        apr_table_set(r->headers_out, "ETag", it.card->tag.c_str());
        apr_table_setn(r->headers_out, "Vary", "Accept");
        ap_update_mtime(r, apr_time_from_sec(static_cast<apr_time_t>(it.card->modified.secondsSince1970())));
        ap_set_last_modified(r);
        ap_set_content_type(r, "text/vcard; charset=utf-8");
        ap_set_content_length(r, static_cast<apr_off_t>(it.card->text.size()));
    });
}

dav_error* deliver(const dav_resource* resource, ap_filter_t* output) noexcept {
    const Resource& it = of(resource);
    static constexpr std::string_view kPage = "<!DOCTYPE html><title>Address books</title>\n"
                                              "<p>Give this address to a contacts program that speaks CardDAV.</p>\n";
    const std::string_view text = it.card ? std::string_view(it.card->text) : kPage;
    apr_bucket_alloc_t* buckets = it.r->connection->bucket_alloc;
    apr_bucket_brigade* brigade = apr_brigade_create(resource->pool, buckets);
    APR_BRIGADE_INSERT_TAIL(brigade, apr_bucket_pool_create(text.data(), text.size(), resource->pool, buckets));
    APR_BRIGADE_INSERT_TAIL(brigade, apr_bucket_eos_create(buckets));
    if (ap_pass_brigade(output, brigade) != APR_SUCCESS)
        return dav_new_error(resource->pool, HTTP_INTERNAL_SERVER_ERROR, 0, 0, "The answer could not be sent.");
    if (!it.card) return nullptr;
    // A note that fails is in the log. The answer has ended, and an error would be written behind it.
    contained(it.r, [&] {
        Devices devices(it.library->memory());
        if (!devices.isCoveredByLook(it.r->user, it.place.book, *it.member))
            devices.noteHad(it.r->user, {{it.member->uid, it.card->modified}});
    });
    return nullptr;
}

// Visits a collection and, where asked, what is in it. The members of a book are made one at a time.
class Walk {
public:
    Walk(const dav_walk_params* parameters, dav_response** response) : _parameters(*parameters), _response(response) {}

    dav_error* visit(const dav_resource* resource, int depth) {
        if (dav_error* error = call(const_cast<dav_resource*>(resource))) return error;
        if (!resource->collection || depth < 1 || !resource->exists) return nullptr;
        const Resource& it = of(resource);
        switch (it.place.kind) {
        case Place::Kind::root:
            if (dav_error* error = visitPlace(it, {Place::Kind::principal, {}, {}}, depth - 1)) return error;
            return visitPlace(it, {Place::Kind::home, {}, {}}, depth - 1);
        case Place::Kind::home:
            for (const Book& book : it.library->books())
                if (dav_error* error = visitPlace(it, {Place::Kind::book, book.id, {}}, depth - 1)) return error;
            return nullptr;
        case Place::Kind::book: return visitMembers(it);
        default: return nullptr;
        }
    }

private:
    dav_error* call(dav_resource* resource) {
        dav_walk_resource at{_parameters.walk_ctx, _parameters.pool, resource, nullptr};
        if (dav_error* error =
                _parameters.func(&at, resource->collection ? DAV_CALLTYPE_COLLECTION : DAV_CALLTYPE_MEMBER))
            return error;
        if (at.response) *_response = at.response;
        return nullptr;
    }

    dav_error* visitPlace(const Resource& from, const Place& place, int depth) {
        return visit(newResource(_parameters.pool, resourceAt(from.r, from.base, place)), depth);
    }

    dav_error* visitMembers(const Resource& book) {
        int64_t latest = 0;
        dav_error* error = visitMembersOfOneMoment(book, latest);
        // A note that fails is in the log.
        if (!error)
            contained(book.r,
                      [&] { Devices(book.library->memory()).noteListed(book.r->user, book.place.book, latest); });
        return error;
    }

    dav_error* visitMembersOfOneMoment(const Resource& book, int64_t& latest) {
        constexpr size_t kPage = 500;
        const SqliteSnapshot moment(book.library->memory().sqlite());
        latest = book.library->memory().latest(book.place.book);
        apr_pool_t* pool = nullptr;
        apr_pool_create(&pool, _parameters.pool);
        dav_error* error = nullptr;
        int64_t from = 0;
        for (bool goesOn = true; goesOn && !error;) {
            std::vector<Member> page = book.library->memory().after(book.place.book, from, false, kPage);
            goesOn = page.size() == kPage;
            if (!page.empty()) from = page.back().sequence;
            for (Member& member : page) {
                apr_pool_clear(pool);
                Resource it = book;
                it.place = {Place::Kind::card, book.place.book, member.name};
                it.member = std::move(member);
                if ((error = call(newResource(pool, std::move(it))))) break;
            }
        }
        if (!error) apr_pool_destroy(pool); // else the error may stand in it
        return error;
    }

    const dav_walk_params& _parameters;
    dav_response** _response;
};

dav_error* walk(const dav_walk_params* parameters, int depth, dav_response** response) noexcept {
    *response = nullptr;
    dav_error* error = nullptr;
    dav_error* thrown =
        contained(of(parameters->root).r, [&] { error = Walk(parameters, response).visit(parameters->root, depth); });
    return thrown ? thrown : error;
}

// Dead properties: none. The struct has to be there all the same.

dav_error* openProperties(apr_pool_t* pool, const dav_resource*, int readOnly, dav_db** db) noexcept {
    *db = nullptr;
    return readOnly ? nullptr : dav_new_error(pool, HTTP_FORBIDDEN, 0, 0, "Cards and books keep no other properties.");
}
void closeProperties(dav_db*) noexcept {}
dav_error* defineNamespaces(dav_db*, dav_xmlns_info*) noexcept {
    return nullptr;
}
dav_error* outputValue(dav_db*, const dav_prop_name*, dav_xmlns_info*, apr_text_header*, int* found) noexcept {
    *found = 0;
    return nullptr;
}
int hasProperty(dav_db*, const dav_prop_name*) noexcept {
    return 0;
}
dav_error* noName(dav_db*, dav_prop_name* name) noexcept {
    *name = {};
    return nullptr;
}

const dav_hooks_propdb kProperties = {openProperties, closeProperties, defineNamespaces, outputValue, nullptr,
                                      nullptr,        nullptr,         hasProperty,      noName,      noName,
                                      nullptr,        nullptr,         nullptr};

} // namespace

const dav_hooks_repository kRepository = {1,          getResource,    getParent,    isSame,       isParent,
                                          openStream, closeStream,    writeStream,  nullptr,      setHeaders,
                                          deliver,    makeCollection, copyResource, moveResource, removeResource,
                                          walk,       entityTag,      nullptr,      requestOf,    noPath};
const dav_provider kProvider = {&kRepository, &kProperties, nullptr, nullptr, nullptr, nullptr, nullptr};

} // namespace rolvane::cardbook
