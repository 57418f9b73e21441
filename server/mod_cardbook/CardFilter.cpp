#include "server/mod_cardbook/CardFilter.h"

#include "contacts/records/RecordKind.h"
#include "contacts/vcard/VCardLine.h"
#include "contacts/vcard/VCardText.h"
#include "server/mod_cardbook/Refused.h"
#include "server/mod_cardbook/XmlText.h"
#include "server/mod_davacl/XmlElements.h"

#include <algorithm>

namespace rolvane::cardbook {
namespace {

using davacl::attributeOf;

constexpr size_t kMostConditions = 100; // each is tried on every card

[[noreturn]] void unsupported(const std::string& words) {
    throw Refused(403, kCardSpace, "supported-filter", words);
}

bool yesNo(const apr_xml_elem* element, const char* name) {
    const std::string value = attributeOf(element, name);
    if (!value.empty() && value != "yes" && value != "no") throw Refused(400, std::string(name) + " is yes or no.");
    return value == "yes";
}

bool isAllOf(const apr_xml_elem* element) {
    const std::string value = attributeOf(element, "test");
    if (!value.empty() && value != "anyof" && value != "allof") throw Refused(400, "test is anyof or allof.");
    return value == "allof";
}

std::string folded(const std::string& text, const TextMatch& match) {
    if (match.byCase) return text;
    return match.asciiOnly ? vcardLower(text) : foldCase(text);
}

TextMatch textMatchOf(const apr_xml_elem* element) {
    TextMatch match;
    const std::string collation = attributeOf(element, "collation");
    match.byCase = collation == "i;octet";
    match.asciiOnly = collation == "i;ascii-casemap";
    if (!collation.empty() && collation != "default" && collation != "i;unicode-casemap" && !match.byCase &&
        !match.asciiOnly)
        throw Refused(403, kCardSpace, "supported-collation", "There is no collation " + collation + " here.");
    const std::string how = attributeOf(element, "match-type");
    if (how == "equals")
        match.how = TextMatch::How::equals;
    else if (how == "starts-with")
        match.how = TextMatch::How::startsWith;
    else if (how == "ends-with")
        match.how = TextMatch::How::endsWith;
    else if (!how.empty() && how != "contains")
        throw Refused(400, "There is no match-type " + how + ".");
    match.negated = yesNo(element, "negate-condition");
    match.text = folded(davacl::textOf(element), match);
    return match;
}

ParameterFilter parameterFilterOf(const apr_xml_doc* doc, const apr_xml_elem* element) {
    ParameterFilter filter;
    filter.name = vcardUpper(attributeOf(element, "name"));
    if (filter.name.empty()) throw Refused(400, "A param-filter names no parameter.");
    for (const apr_xml_elem* e = element->first_child; e; e = e->next) {
        if (isCard(doc, e, "is-not-defined"))
            filter.isNotDefined = true;
        else if (isCard(doc, e, "text-match"))
            filter.matches.push_back(textMatchOf(e));
        else
            unsupported("A param-filter has is-not-defined or a text-match.");
    }
    if (filter.matches.size() + filter.isNotDefined > 1) throw Refused(400, "A param-filter has one condition.");
    return filter;
}

PropertyFilter propertyFilterOf(const apr_xml_doc* doc, const apr_xml_elem* element) {
    PropertyFilter filter;
    filter.name = vcardUpper(attributeOf(element, "name"));
    if (const size_t dot = filter.name.find('.'); dot != std::string::npos) {
        filter.group = filter.name.substr(0, dot);
        filter.name.erase(0, dot + 1);
    }
    if (filter.name.empty()) throw Refused(400, "A prop-filter names no property.");
    filter.all = isAllOf(element);
    for (const apr_xml_elem* e = element->first_child; e; e = e->next) {
        if (isCard(doc, e, "is-not-defined"))
            filter.isNotDefined = true;
        else if (isCard(doc, e, "text-match"))
            filter.matches.push_back(textMatchOf(e));
        else if (isCard(doc, e, "param-filter"))
            filter.parameters.push_back(parameterFilterOf(doc, e));
        else
            unsupported("A prop-filter has is-not-defined, text-match and param-filter.");
    }
    if (filter.isNotDefined && (!filter.matches.empty() || !filter.parameters.empty()))
        throw Refused(400, "is-not-defined stands alone.");
    return filter;
}

bool holds(const TextMatch& match, const std::string& value) {
    const std::string text = folded(value, match);
    bool is = false;
    switch (match.how) {
    case TextMatch::How::equals: is = text == match.text; break;
    case TextMatch::How::contains: is = text.find(match.text) != std::string::npos; break;
    case TextMatch::How::startsWith: is = text.starts_with(match.text); break;
    case TextMatch::How::endsWith: is = text.ends_with(match.text); break;
    }
    return is != match.negated;
}

bool holds(const ParameterFilter& filter, const VCardLine& line) {
    const VCardParameter* parameter = line.parameter(filter.name);
    if (filter.isNotDefined) return !parameter;
    if (!parameter) return false;
    if (filter.matches.empty()) return true;
    const TextMatch& match = filter.matches.front();
    TextMatch plain = match;
    plain.negated = false;
    const bool any = std::any_of(parameter->values.begin(), parameter->values.end(),
                                 [&](const std::string& value) { return holds(plain, value); });
    return any != match.negated;
}

bool holds(const PropertyFilter& filter, const VCardLine& line) {
    if (filter.matches.empty() && filter.parameters.empty()) return true;
    const std::string value = vcardUnescape(line.value);
    const auto met = [&](const auto& condition) {
        if constexpr (std::is_same_v<std::decay_t<decltype(condition)>, TextMatch>)
            return holds(condition, value);
        else
            return holds(condition, line);
    };
    const std::vector<TextMatch>& texts = filter.matches;
    const std::vector<ParameterFilter>& parameters = filter.parameters;
    if (filter.all)
        return std::all_of(texts.begin(), texts.end(), met) && std::all_of(parameters.begin(), parameters.end(), met);
    return std::any_of(texts.begin(), texts.end(), met) || std::any_of(parameters.begin(), parameters.end(), met);
}

std::vector<VCardLine> linesOf(const std::string& card) {
    std::vector<VCardLine> lines;
    std::string unfolded;
    const auto take = [&] {
        if (auto line = vcardParseLine(unfolded)) lines.push_back(std::move(*line));
        unfolded.clear();
    };
    for (size_t at = 0; at < card.size();) {
        const size_t end = std::min(card.find('\n', at), card.size());
        std::string_view line = std::string_view(card).substr(at, end - at);
        if (line.ends_with('\r')) line.remove_suffix(1);
        const bool goesOn = !line.empty() && (line.front() == ' ' || line.front() == '\t');
        if (!goesOn) take();
        unfolded += goesOn ? line.substr(1) : line;
        at = end + 1;
    }
    take();
    return lines;
}

bool holds(const PropertyFilter& filter, const std::vector<VCardLine>& lines) {
    bool defined = false;
    for (const VCardLine& line : lines) {
        if (line.name != filter.name || (!filter.group.empty() && vcardUpper(line.group) != filter.group)) continue;
        defined = true;
        if (!filter.isNotDefined && holds(filter, line)) return true;
    }
    return filter.isNotDefined && !defined;
}

} // namespace

bool CardFilter::meets(const std::string& card) const {
    if (properties.empty()) return true;
    const std::vector<VCardLine> lines = linesOf(card);
    const auto met = [&](const PropertyFilter& filter) { return holds(filter, lines); };
    return all ? std::all_of(properties.begin(), properties.end(), met)
               : std::any_of(properties.begin(), properties.end(), met);
}

CardFilter parseFilter(const apr_xml_doc* doc, const apr_xml_elem* filter) {
    CardFilter read;
    if (!filter) return read; // some clients leave it out where they want everything
    read.all = isAllOf(filter);
    size_t conditions = 0;
    for (const apr_xml_elem* e = filter->first_child; e; e = e->next) {
        if (!isCard(doc, e, "prop-filter")) unsupported("A filter has prop-filter elements.");
        read.properties.push_back(propertyFilterOf(doc, e));
        conditions += 1 + read.properties.back().matches.size() + read.properties.back().parameters.size();
        if (conditions > kMostConditions) unsupported("The filter has too many conditions.");
    }
    return read;
}

} // namespace rolvane::cardbook
