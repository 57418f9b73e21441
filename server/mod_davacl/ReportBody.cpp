#include "server/mod_davacl/ReportBody.h"

#include "server/mod_davacl/XmlElements.h"

#include <algorithm>
#include <cstring>

namespace rolvane::davacl {
namespace {

bool hasNoOtherAscii(const std::string& name) {
    return !name.empty() && !std::strchr("-.0123456789", name[0]) &&
           std::all_of(name.begin(), name.end(), [](unsigned char c) {
               return c >= 0x80 || (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                      c == '-' || c == '.' || c == '_';
           });
}

// Beyond ASCII the parser that reads answers decides.
bool isReadable(const std::string& name) {
    apr_pool_t* pool = nullptr;
    if (apr_pool_create(&pool, nullptr) != APR_SUCCESS) return false;
    const std::string element = "<" + name + "/>";
    apr_xml_parser* parser = apr_xml_parser_create(pool);
    apr_xml_doc* doc = nullptr;
    const bool fed = apr_xml_parser_feed(parser, element.data(), element.size()) == APR_SUCCESS;
    const bool isRead = apr_xml_parser_done(parser, &doc) == APR_SUCCESS && fed;
    apr_pool_destroy(pool);
    return isRead;
}

bool isXmlName(const std::string& name) {
    const bool isAscii = std::all_of(name.begin(), name.end(), [](unsigned char c) { return c < 0x80; });
    return hasNoOtherAscii(name) && (isAscii || isReadable(name));
}

bool isOwn(const apr_xml_doc* doc, const apr_xml_elem* element, const char* name) {
    return std::strcmp(element->name, name) == 0 && spaceOf(doc, element) == kOwnNamespace;
}

} // namespace

std::vector<Wanted> namesIn(const apr_xml_doc* doc, const apr_xml_elem* prop) {
    std::vector<Wanted> wanted;
    for (const apr_xml_elem* e = prop ? prop->first_child : nullptr; e; e = e->next)
        wanted.push_back({unquoted(spaceOf(doc, e)), e->name}); // APR keeps spaces as they are written
    return wanted;
}

bool canBeAnswered(const std::vector<Wanted>& names) {
    return std::all_of(names.begin(), names.end(), [](const Wanted& each) { return hasNoOtherAscii(each.name); });
}

std::string emptyElement(apr_pool_t* pool, const Wanted& property) {
    if (property.space == "DAV:") return "<D:" + property.name + "/>";
    return "<" + property.name + " xmlns=\"" + apr_xml_quote_string(pool, property.space.c_str(), 1) + "\"/>";
}

std::optional<PrincipalMatch> parsePrincipalMatch(const apr_xml_doc* doc, const char*& problem) {
    const apr_xml_elem* property = child(doc->root, "principal-property");
    const apr_xml_elem* name = property ? property->first_child : nullptr;
    problem = nullptr;
    if (!child(doc->root, "self") == !name) problem = "DAV:principal-match says self or one principal-property.";
    return problem ? std::nullopt : std::optional(PrincipalMatch{name});
}

std::optional<std::vector<PropertySearch>> parseSearches(const apr_xml_doc* doc, const char*& problem) {
    std::vector<PropertySearch> searches;
    for (const apr_xml_elem* e = doc->root->first_child; e; e = e->next)
        if (isDav(e, "property-search"))
            searches.push_back({namesIn(doc, child(e, "prop")), textOf(child(e, "match"))});
    problem = nullptr;
    if (searches.empty() || std::any_of(searches.begin(), searches.end(), [](const PropertySearch& s) {
            return s.properties.empty() || s.match.empty();
        }))
        problem = "DAV:property-search says a property and what it matches.";
    return problem ? std::nullopt : std::optional(std::move(searches));
}

Wanted nameOf(const apr_xml_elem* property) {
    const std::string space = attributeOf(property, "namespace");
    return {space.empty() ? "DAV:" : space, attributeOf(property, "name")};
}

bool areNamed(const apr_xml_elem* properties) {
    for (const apr_xml_elem* e = properties->first_child; e; e = e->next)
        if (isDav(e, "property") && (!isXmlName(nameOf(e).name) || !areNamed(e))) return false;
    return true;
}

bool isDeeperThan(const apr_xml_elem* root, size_t levels) {
    if (levels == 0) return true;
    for (const apr_xml_elem* e = root->first_child; e; e = e->next)
        if (isDeeperThan(e, levels - 1)) return true;
    return false;
}

bool isNewsReport(const apr_xml_doc* doc) {
    return isOwn(doc, doc->root, kNewsReport);
}

NewsBody readNewsBody(const apr_xml_doc* doc) {
    NewsBody body;
    for (const apr_xml_elem* e = doc->root->first_child; e; e = e->next) {
        if (isDav(e, "href")) body.hrefs.push_back(textOf(e));
        if (!body.since && isOwn(doc, e, "since")) body.since = textOf(e);
    }
    return body;
}

std::string unquoted(std::string text) {
    for (const auto& [from, to] : {std::pair("&lt;", "<"), {"&gt;", ">"}, {"&quot;", "\""}, {"&amp;", "&"}})
        for (size_t at = 0; (at = text.find(from, at)) != std::string::npos; ++at)
            text.replace(at, std::strlen(from), to);
    return text;
}

} // namespace rolvane::davacl
