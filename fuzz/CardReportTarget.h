#pragma once

#include "server/mod_cardbook/PartialCard.h"
#include "server/mod_cardbook/Place.h"
#include "server/mod_cardbook/Refused.h"
#include "server/mod_cardbook/ReportRequest.h"

#include <cstdint>
#include <stdexcept>
#include <string>

#include <apr_general.h>
#include <apr_pools.h>
#include <apr_xml.h>

namespace rolvane::fuzz {

// The body of a REPORT on a book: it is refused with a status of the 4xx class, or what it asks for is applied to a
// card, whose frame every part of it keeps, and whose paths lead back to themselves.
inline void checkCardReport(const uint8_t* data, size_t size) {
    static const bool ready = apr_initialize() == APR_SUCCESS;
    apr_pool_t* pool = nullptr;
    if (!ready || apr_pool_create(&pool, nullptr) != APR_SUCCESS) throw std::runtime_error("no pool");
    struct Destroyed {
        apr_pool_t* pool;
        ~Destroyed() { apr_pool_destroy(pool); }
    } const destroyed{pool};
    apr_xml_parser* parser = apr_xml_parser_create(pool);
    apr_xml_doc* doc = nullptr;
    const bool fed = apr_xml_parser_feed(parser, reinterpret_cast<const char*>(data), size) == APR_SUCCESS;
    if (apr_xml_parser_done(parser, &doc) != APR_SUCCESS || !fed) return;

    using namespace cardbook;
    ReportRequest request;
    try {
        request = parseReport(doc);
    } catch (const Refused& refused) {
        if (refused.status() < 400 || refused.status() > 499) throw std::runtime_error("an odd status");
        return;
    }
    static const std::string kCard = "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:1\r\nFN:A B\r\nN:B;A;;;\r\n"
                                     "item1.TEL;TYPE=\"a:b\",home:+1\r\nNOTE:long\r\n  er\r\nEND:VCARD\r\n";
    request.filter.meets(kCard);
    if (request.filter.isEverything() && !request.filter.meets("")) throw std::runtime_error("not everything");
    if (request.data) {
        const std::string part = partialCard(kCard, request.data->lines);
        if (!part.starts_with("BEGIN:VCARD\r\nVERSION:3.0\r\n") || !part.ends_with("END:VCARD\r\n"))
            throw std::runtime_error("a card without its frame");
        if (part.size() > kCard.size()) throw std::runtime_error("more than the whole");
    }
    if (request.limit && *request.limit == 0) throw std::runtime_error("a limit of nothing");
    for (const std::string& href : request.hrefs) {
        const auto path = pathOfHref(href);
        const auto place = path ? placeOf("/books", *path) : std::nullopt;
        if (!place || place->kind == Place::Kind::nowhere) continue;
        const std::string written = pathOf("/books", *place);
        const auto again = pathOfHref(escapedPath(written));
        if (!again || *again != written || placeOf("/books", *again) != place)
            throw std::runtime_error("another place");
    }
}

} // namespace rolvane::fuzz
