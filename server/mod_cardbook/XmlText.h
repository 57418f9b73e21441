#pragma once

#include <apr_xml.h>

#include <string>
#include <string_view>

namespace rolvane::cardbook {

// Text as it stands between tags or in an attribute. A carriage return is written as a reference: as it stands it would
// arrive as a line feed. Well-formed UTF-8 is expected; control characters that XML cannot carry are left out.
void appendXml(std::string& out, std::string_view text);
std::string xmlText(std::string_view text);

bool isCard(const apr_xml_doc* doc, const apr_xml_elem* element, std::string_view name); // of RFC 6352's namespace
const apr_xml_elem* cardChild(const apr_xml_doc* doc, const apr_xml_elem* of, std::string_view name);

} // namespace rolvane::cardbook
