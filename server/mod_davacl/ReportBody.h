#pragma once

#include <apr_xml.h>

#include <cstddef>
#include <optional>
#include <string>
#include <vector>

namespace rolvane::davacl {

// The bodies of the reports that the module answers itself, read without asking anything of httpd. A body that its RFC
// does not allow gives nothing; `problem` then tells why.

inline constexpr const char* kOwnNamespace = "http://rolvane.net/ns/";
inline constexpr const char* kNewsReport = "news"; // in kOwnNamespace

struct Wanted {
    std::string space, name; // of a property
};
// <name/> in its namespace, with D for DAV:.
std::string emptyElement(apr_pool_t* pool, const Wanted& property);
// The elements in a DAV:prop, which may be null.
std::vector<Wanted> namesIn(const apr_xml_doc* doc, const apr_xml_elem* prop);
// Whether every name can stand in an answer: APR takes a second colon for a part of a name.
bool canBeAnswered(const std::vector<Wanted>& names);

// RFC 3744 section 9.3. The property is null for DAV:self.
struct PrincipalMatch {
    const apr_xml_elem* property = nullptr;
};
std::optional<PrincipalMatch> parsePrincipalMatch(const apr_xml_doc* doc, const char*& problem);

// RFC 3744 section 9.4: at least one, and none of them without a property and a text.
struct PropertySearch {
    std::vector<Wanted> properties;
    std::string match;
};
std::optional<std::vector<PropertySearch>> parseSearches(const apr_xml_doc* doc, const char*& problem);

// RFC 3253 section 3.8. Which property a DAV:property means.
Wanted nameOf(const apr_xml_elem* property);
// Whether every DAV:property has a name that can stand in an answer.
bool areNamed(const apr_xml_elem* properties);
// Whether elements stand within each other in more levels than that.
bool isDeeperThan(const apr_xml_elem* root, size_t levels);

// The report "news": the hrefs as they were sent, and where to go on.
struct NewsBody {
    std::vector<std::string> hrefs;
    std::optional<std::string> since;
};
bool isNewsReport(const apr_xml_doc* doc);
NewsBody readNewsBody(const apr_xml_doc* doc);

// Text as it is written in XML, without &lt;, &gt;, &quot; and &amp;.
std::string unquoted(std::string text);

} // namespace rolvane::davacl
