#include "server/mod_davacl/XmlElements.h"

#include <algorithm>

namespace rolvane::davacl {
namespace {

void append(std::string& text, const apr_text_header& pieces) {
    for (const apr_text* piece = pieces.first; piece; piece = piece->next) text += piece->text;
}

} // namespace

bool isDav(const apr_xml_elem* element, std::string_view name) {
    return element && element->ns == APR_XML_NS_DAV_ID && element->name == name;
}

const apr_xml_elem* child(const apr_xml_elem* of, std::string_view name) {
    for (const apr_xml_elem* e = of ? of->first_child : nullptr; e; e = e->next)
        if (isDav(e, name)) return e;
    return nullptr;
}

size_t countOf(const apr_xml_elem* of, std::string_view name) {
    size_t count = 0;
    for (const apr_xml_elem* e = of ? of->first_child : nullptr; e; e = e->next) count += isDav(e, name);
    return count;
}

size_t elementsIn(const apr_xml_elem* of) {
    size_t count = 0;
    for (const apr_xml_elem* e = of ? of->first_child : nullptr; e; e = e->next) ++count;
    return count;
}

std::string textOf(const apr_xml_elem* element) {
    std::string text;
    if (!element) return text;
    append(text, element->first_cdata);
    for (const apr_xml_elem* e = element->first_child; e; e = e->next) append(text, e->following_cdata);
    constexpr std::string_view blank = " \t\r\n";
    text.erase(0, std::min(text.find_first_not_of(blank), text.size()));
    text.erase(text.find_last_not_of(blank) + 1);
    return text;
}

std::string attributeOf(const apr_xml_elem* element, std::string_view name) {
    for (const apr_xml_attr* a = element ? element->attr : nullptr; a; a = a->next)
        if (a->ns == APR_XML_NS_NONE && a->name == name) return a->value;
    return {};
}

std::string spaceOf(const apr_xml_doc* doc, const apr_xml_elem* element) {
    if (element->ns < 0) return {};
    return APR_XML_GET_URI_ITEM(doc->namespaces, element->ns);
}

} // namespace rolvane::davacl
