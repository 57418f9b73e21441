#pragma once

#include <apr_xml.h>

#include <string>
#include <vector>

namespace rolvane::cardbook {

struct TextMatch {
    enum class How { equals, contains, startsWith, endsWith };
    std::string text; // folded as `byCase` wants
    How how = How::contains;
    bool byCase = false; // i;octet; else letters of any script without case
    bool asciiOnly = false;
    bool negated = false;
};

struct ParameterFilter {
    std::string name; // in capitals
    bool isNotDefined = false;
    std::vector<TextMatch> matches; // one at most; none: is defined
};

struct PropertyFilter {
    std::string group, name; // the name in capitals; a group only where it names one
    bool isNotDefined = false;
    bool all = false; // of the conditions, else any
    std::vector<TextMatch> matches;
    std::vector<ParameterFilter> parameters;
};

// The filter of an addressbook-query (RFC 6352 section 10.5). One without conditions meets every card.
struct CardFilter {
    bool all = false; // of the properties, else any
    std::vector<PropertyFilter> properties;

    bool isEverything() const { return properties.empty(); }
    // Of a card's text. Pure.
    bool meets(const std::string& card) const;
};

// Throws Refused, supported-filter and supported-collation among the reasons.
CardFilter parseFilter(const apr_xml_doc* doc, const apr_xml_elem* filter);

} // namespace rolvane::cardbook
