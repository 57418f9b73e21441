#include "server/mod_cardbook/XmlText.h"

#include "server/mod_cardbook/Refused.h"
#include "server/mod_davacl/XmlElements.h"

namespace rolvane::cardbook {

void appendXml(std::string& out, std::string_view text) {
    size_t from = 0;
    for (size_t i = 0; i < text.size(); ++i) {
        const char c = text[i];
        const char* written = nullptr;
        if (c == '&')
            written = "&amp;";
        else if (c == '<')
            written = "&lt;";
        else if (c == '>')
            written = "&gt;";
        else if (c == '"')
            written = "&quot;";
        else if (c == '\r')
            written = "&#13;";
        else if (c >= 0 && c < 0x20 && c != '\t' && c != '\n')
            written = "";
        if (!written) continue;
        out.append(text.substr(from, i - from)).append(written);
        from = i + 1;
    }
    out.append(text.substr(from));
}

std::string xmlText(std::string_view text) {
    std::string out;
    appendXml(out, text);
    return out;
}

bool isCard(const apr_xml_doc* doc, const apr_xml_elem* element, std::string_view name) {
    return element && element->name == name && davacl::spaceOf(doc, element) == kCardSpace;
}

const apr_xml_elem* cardChild(const apr_xml_doc* doc, const apr_xml_elem* of, std::string_view name) {
    for (const apr_xml_elem* e = of ? of->first_child : nullptr; e; e = e->next)
        if (isCard(doc, e, name)) return e;
    return nullptr;
}

} // namespace rolvane::cardbook
