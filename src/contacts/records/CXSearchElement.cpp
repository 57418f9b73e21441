#include "contacts/records/CXSearchElement.h"

#include "contacts/records/CXMultiValue.h"

#include <algorithm>
#include <cctype>
#include <optional>

namespace rolvane {

namespace {

std::string folded(std::string text) {
    std::transform(text.begin(), text.end(), text.begin(), [](unsigned char c) {
        return c < 0x80 ? static_cast<char>(std::tolower(c)) : static_cast<char>(c);
    });
    return text;
}

// How a stands to b; nothing when the two kinds have no order between them.
std::optional<std::partial_ordering> order(const Value& a, const Value& b) {
    if (a.isDate() && b.isDate()) return a.date()->secondsSince1970() <=> b.date()->secondsSince1970();
    if (a.isNumber() && b.isNumber()) return a.real() <=> b.real();
    if (a.isString() && b.isString()) return a.string() <=> b.string();
    return std::nullopt;
}

bool compares(const Value& a, const Value& b, CXSearchComparison comparison) {
    auto ordered = order(a, b);
    switch (comparison) {
    case kCXEqual: return a == b;
    case kCXNotEqual: return !(a == b);
    case kCXLessThan: return ordered && *ordered < 0;
    case kCXLessThanOrEqual: return ordered && *ordered <= 0;
    case kCXGreaterThan: return ordered && *ordered > 0;
    case kCXGreaterThanOrEqual: return ordered && *ordered >= 0;
    case kCXEqualCaseInsensitive: return a.isString() && b.isString() && folded(a.string()) == folded(b.string());
    case kCXContainsSubStringCaseInsensitive:
        return a.isString() && b.isString() && folded(a.string()).find(folded(b.string())) != std::string::npos;
    }
    return false;
}

} // namespace

bool CXSearchElement::matches(const Value& propertyValue) const {
    auto one = [this](const Value& v) {
        if (key.empty()) return compares(v, value, comparison);
        return v.isDictionary() && compares((*v.dictionaryIf())[key], value, comparison);
    };
    std::optional<CXMultiValue> multi = CXMultiValue::fromValue(propertyValue);
    if (!multi) return one(propertyValue);
    return std::any_of(multi->entries().begin(), multi->entries().end(),
                       [&](const auto& e) { return (label.empty() || e.label == label) && one(e.value); });
}

} // namespace rolvane
