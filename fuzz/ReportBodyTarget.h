#pragma once

#include "AclBodyTarget.h"

#include "server/mod_davacl/ReportBody.h"
#include "server/mod_davacl/SyncRequest.h"
#include "server/mod_davacl/SyncToken.h"
#include "server/mod_davacl/XmlElements.h"

#include <cstdint>
#include <stdexcept>
#include <string>
#include <vector>

namespace rolvane::fuzz {

// A name that was asked for stands in an answer as it was asked for, whatever it is.
inline void checkNames(const AprPool& pool, const std::vector<davacl::Wanted>& names) {
    std::string text = "<D:x xmlns:D=\"DAV:\">";
    for (const davacl::Wanted& each : names) text += davacl::emptyElement(pool, each);
    text += "</D:x>";
    const apr_xml_doc* doc = readXml(pool, reinterpret_cast<const uint8_t*>(text.data()), text.size());
    if (!doc) throw std::logic_error("names make an answer that is no XML: " + text);
    const auto read = davacl::namesIn(doc, doc->root);
    if (read.size() != names.size()) throw std::logic_error("names make more elements: " + text);
    for (size_t i = 0; i < read.size(); ++i)
        if (read[i].space != names[i].space || read[i].name != names[i].name)
            throw std::logic_error("a name is answered as another: " + text);
}

inline void checkExpansion(const AprPool& pool, const apr_xml_elem* properties, size_t levels) {
    if (levels == 0) throw std::logic_error("properties nest deeper than was found");
    for (const apr_xml_elem* e = properties->first_child; e; e = e->next) {
        if (!davacl::isDav(e, "property")) continue;
        checkNames(pool, {davacl::nameOf(e)});
        checkExpansion(pool, e, levels - 1);
    }
}

inline void checkSync(const apr_xml_doc* doc) {
    const char* problem = nullptr;
    const auto request = davacl::parseSyncRequest(doc->root, problem);
    if (!request == !problem) throw std::logic_error("a refusal without a word, or a word without a refusal");
    if (!request) return;
    if (request->limit && *request->limit == 0) throw std::logic_error("a limit of nothing");
    const auto token = davacl::SyncToken::parse(request->token);
    if (!token) return;
    const auto again = davacl::SyncToken::parse(token->text());
    if (!again || again->text() != token->text() || again->isDeep != token->isDeep ||
        again->cut.has_value() != token->cut.has_value())
        throw std::logic_error("a token reads back as another");
}

// Any body of a REPORT: every report of the module reads it, whichever it is. Throws std::logic_error when a promise
// does not hold that the answers rely on.
inline void checkReportBody(const uint8_t* data, size_t size) {
    const AprPool pool;
    const apr_xml_doc* doc = readXml(pool, data, size);
    if (!doc || !doc->root) return;
    const auto names = davacl::namesIn(doc, davacl::child(doc->root, "prop"));
    if (davacl::canBeAnswered(names)) checkNames(pool, names);
    checkSync(doc);
    const char* problem = nullptr;
    if (!davacl::parsePrincipalMatch(doc, problem) != (problem != nullptr))
        throw std::logic_error("a refusal without a word");
    const auto searches = davacl::parseSearches(doc, problem);
    if (!searches == !problem) throw std::logic_error("a refusal without a word");
    if (searches) {
        if (searches->empty()) throw std::logic_error("no search");
        for (const auto& each : *searches)
            if (each.properties.empty() || each.match.empty()) throw std::logic_error("a search for nothing");
    }
    constexpr size_t kLevels = 9;
    if (!davacl::isDeeperThan(doc->root, kLevels) && davacl::areNamed(doc->root))
        checkExpansion(pool, doc->root, kLevels);
    const davacl::NewsBody news = davacl::readNewsBody(doc);
    if (news.hrefs.size() > davacl::elementsIn(doc->root)) throw std::logic_error("more trees than elements");
    for (const std::string& href : news.hrefs)
        if (davacl::unquoted(apr_xml_quote_string(pool, href.c_str(), 1)) != href)
            throw std::logic_error("a text that was written reads as another");
}

} // namespace rolvane::fuzz
