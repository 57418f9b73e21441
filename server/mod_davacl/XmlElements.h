#pragma once

#include <apr_xml.h>

#include <cstddef>
#include <string>
#include <string_view>

namespace rolvane::davacl {

// Looking at what APR has read of a request's body. An element of no namespace, and one of another namespace than
// DAV:, is never found by its name here. Null elements have nothing in them.
bool isDav(const apr_xml_elem* element, std::string_view name);
const apr_xml_elem* child(const apr_xml_elem* of, std::string_view name); // the first one, or null
size_t countOf(const apr_xml_elem* of, std::string_view name);
size_t elementsIn(const apr_xml_elem* of);
// The text right in the element, without blanks around it.
std::string textOf(const apr_xml_elem* element);
// The value of an attribute of no namespace, "" without it.
std::string attributeOf(const apr_xml_elem* element, std::string_view name);
// The namespace of an element, "" when it has none.
std::string spaceOf(const apr_xml_doc* doc, const apr_xml_elem* element);

} // namespace rolvane::davacl
