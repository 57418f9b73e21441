#include "server/mod_cardbook/Writing.h"

#include "server/mod_cardbook/CardWriter.h"
#include "server/mod_cardbook/Resource.h"

#include <string_view>
#include <strings.h>

namespace rolvane::cardbook {
namespace {

// Whose type is not said is taken for a card.
bool isCardType(const char* type) {
    if (!type) return true;
    const std::string_view text(type);
    for (const std::string_view known : {"text/vcard", "text/x-vcard", "text/directory"})
        if (text.size() >= known.size() && strncasecmp(text.data(), known.data(), known.size()) == 0) return true;
    return false;
}

Refused tooLarge(apr_off_t limit) {
    return {HTTP_FORBIDDEN, kCardSpace, "max-resource-size", "A card has " + std::to_string(limit) + " bytes at most."};
}

Refused onlyCards() {
    return {HTTP_FORBIDDEN, kCardSpace, "addressbook-collection-location-ok",
            "Books are made as groups and subscriptions, not here."};
}

// Those that a further version may fail. The header If never gets here: nothing of it holds where there are no locks.
Conditions conditionsOf(const request_rec* r) {
    Conditions conditions;
    const char *match = apr_table_get(r->headers_in, "If-Match"),
               *other = apr_table_get(r->headers_in, "If-None-Match");
    conditions.exists = match && *match == '*';
    conditions.namesTag = match && *match != '*';
    conditions.isAbsent = other && *other == '*';
    conditions.hasDate = !match && apr_table_get(r->headers_in, "If-Unmodified-Since");
    return conditions;
}

CardWriter writerOf(const Resource& it) {
    if (it.place.kind != Place::Kind::card) throw onlyCards();
    if (!it.book) throw Refused(HTTP_NOT_FOUND, "There is no such book.");
    return {*it.library, WriteContext{*it.book, it.place.name, it.base, it.r->user, conditionsOf(it.r), it.member,
                                      isThunderbird(it.r)}};
}

} // namespace
} // namespace rolvane::cardbook

struct dav_stream {
    const dav_resource* resource;
    apr_off_t limit;
    std::string text;
};

namespace rolvane::cardbook {

// mod_dav removes what is in a destination's way before anything else; here it may be the very same record.
int prepareMethod(request_rec* r, dav_resource*, const dav_resource* destination, const apr_xml_doc*,
                  dav_error**) noexcept {
    const bool isCopyOrMove = r->method_number == M_COPY || r->method_number == M_MOVE;
    if (isCopyOrMove && destination && isOurs(destination)) of(destination).isReplaced = true;
    return DECLINED;
}

dav_error* openStream(const dav_resource* resource, dav_stream_mode, dav_stream** stream) noexcept {
    const Resource& it = of(resource);
    return contained(it.r, [&] {
        if (it.place.kind != Place::Kind::card || !it.book) throw onlyCards();
        if (!isCardType(apr_table_get(it.r->headers_in, "Content-Type")))
            throw Refused(HTTP_FORBIDDEN, kCardSpace, "supported-address-data", "Only text/vcard is kept here.");
        if (apr_table_get(it.r->headers_in, "Content-Range"))
            throw Refused(HTTP_BAD_REQUEST, "A card is written as a whole.");
        const apr_off_t limit = configurationOf(it.r).cardBytes();
        const char* length = apr_table_get(it.r->headers_in, "Content-Length");
        if (length && apr_atoi64(length) > limit) throw tooLarge(limit);
        auto* made = new (apr_palloc(resource->pool, sizeof(dav_stream))) dav_stream{resource, limit, {}};
        apr_pool_cleanup_register(
            resource->pool, made,
            [](void* data) -> apr_status_t {
                static_cast<dav_stream*>(data)->~dav_stream();
                return APR_SUCCESS;
            },
            apr_pool_cleanup_null);
        *stream = made;
    });
}

dav_error* writeStream(dav_stream* stream, const void* bytes, apr_size_t count) noexcept {
    return contained(of(stream->resource).r, [&] {
        if (static_cast<apr_off_t>(stream->text.size() + count) > stream->limit) throw tooLarge(stream->limit);
        stream->text.append(static_cast<const char*>(bytes), count);
    });
}

dav_error* closeStream(dav_stream* stream, int commit) noexcept {
    if (!commit) return nullptr;
    const Resource& it = of(stream->resource);
    return contained(it.r, [&] {
        const Written written = writerOf(it).put(stream->text);
        if (!written.tag.empty()) apr_table_set(it.r->headers_out, "ETag", written.tag.c_str());
    });
}

dav_error* removeResource(dav_resource* resource, dav_response** response) noexcept {
    *response = nullptr;
    const Resource& it = of(resource);
    if (it.isReplaced) return nullptr;
    return contained(it.r, [&] {
        writerOf(it).remove();
        resource->exists = 0;
    });
}

dav_error* makeCollection(dav_resource* resource) noexcept {
    return errorOf(resource->pool, onlyCards());
}

namespace {

dav_error* transfer(const dav_resource* from, dav_resource* to, bool isMove) {
    const Resource &source = of(from), &target = of(to);
    return contained(source.r, [&] {
        if (target.place.kind != Place::Kind::card || !target.book) throw onlyCards();
        CardWriter writer = writerOf(source);
        if (isMove)
            writer.move(*target.book, target.place.name, true);
        else
            writer.copy(*target.book, target.place.name, true);
        to->exists = 1;
    });
}

} // namespace

dav_error* copyResource(const dav_resource* from, dav_resource* to, int, dav_response** response) noexcept {
    *response = nullptr;
    return transfer(from, to, false);
}

dav_error* moveResource(dav_resource* from, dav_resource* to, dav_response** response) noexcept {
    *response = nullptr;
    return transfer(from, to, true);
}

} // namespace rolvane::cardbook
