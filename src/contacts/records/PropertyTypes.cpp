// Which properties the classes of records know, and what is left of a dictionary from outside.

#include "contacts/records/CXRecord.h"
#include "contacts/records/RecordKind.h"
#include "contacts/records/SharingDates.h"
#include "foundation/Utf8.h"

#include <algorithm>
#include <array>

namespace rolvane {

namespace {

using Type = CXPropertyType;

struct KnownProperty {
    std::string_view name;
    CXPropertyType type;
};

constexpr std::array kAnyRecord{KnownProperty{kCXRemoteLocationProperty, Type::multiString},
                                KnownProperty{kCXReadSharingACLProperty, Type::multiString},
                                KnownProperty{kCXReadWriteSharingACLProperty, Type::multiString},
                                KnownProperty{kCXNoteProperty, Type::string},
                                KnownProperty{kCXVCardExtraProperty, Type::array}};

constexpr std::array kGroupOnly{KnownProperty{kCXGroupNameProperty, Type::string},
                                KnownProperty{kCXReadSharingDatesProperty, Type::multiDate},
                                KnownProperty{kCXReadWriteSharingDatesProperty, Type::multiDate}};

constexpr std::array kSubscriptionOnly{KnownProperty{kCXRemoteLocationProperty, Type::string},
                                       KnownProperty{kCXSubscriptionIsAllProperty, Type::boolean},
                                       KnownProperty{kCXSubscriptionNameProperty, Type::string}};

constexpr std::array kPersonOnly{KnownProperty{kCXFirstNameProperty, Type::string},
                                 KnownProperty{kCXLastNameProperty, Type::string},
                                 KnownProperty{kCXMiddleNameProperty, Type::string},
                                 KnownProperty{kCXTitleProperty, Type::string},
                                 KnownProperty{kCXSuffixProperty, Type::string},
                                 KnownProperty{kCXNicknameProperty, Type::string},
                                 KnownProperty{kCXMaidenNameProperty, Type::string},
                                 KnownProperty{kCXFirstNamePhoneticProperty, Type::string},
                                 KnownProperty{kCXMiddleNamePhoneticProperty, Type::string},
                                 KnownProperty{kCXLastNamePhoneticProperty, Type::string},
                                 KnownProperty{kCXFormattedNameProperty, Type::string},
                                 KnownProperty{kCXOrganizationProperty, Type::string},
                                 KnownProperty{kCXDepartmentProperty, Type::string},
                                 KnownProperty{kCXJobTitleProperty, Type::string},
                                 KnownProperty{kCXHomePageProperty, Type::string},
                                 KnownProperty{kCXBirthdayProperty, Type::date},
                                 KnownProperty{kCXBirthdayTextProperty, Type::string},
                                 KnownProperty{kCXPhotoProperty, Type::data},
                                 KnownProperty{kCXPhotoTypeProperty, Type::string},
                                 KnownProperty{kCXIsCompanyProperty, Type::boolean},
                                 KnownProperty{kCXCategoriesProperty, Type::array},
                                 KnownProperty{kCXPhoneProperty, Type::multiString},
                                 KnownProperty{kCXEmailProperty, Type::multiString},
                                 KnownProperty{kCXAddressProperty, Type::multiDictionary},
                                 KnownProperty{kCXURLsProperty, Type::multiString},
                                 KnownProperty{kCXInstantMessageProperty, Type::multiAny},
                                 KnownProperty{kCXRelatedNamesProperty, Type::multiString},
                                 KnownProperty{kCXOtherDatesProperty, Type::multiAny}};

template <size_t N>
std::optional<CXPropertyType> typeIn(const std::array<KnownProperty, N>& properties, std::string_view name) {
    auto found = std::find_if(properties.begin(), properties.end(), [&](const auto& p) { return p.name == name; });
    if (found == properties.end()) return std::nullopt;
    return found->type;
}

bool isMulti(CXPropertyType type) {
    return type >= Type::multiString;
}

bool isOfType(const Value& value, CXPropertyType type) {
    switch (type) {
    case Type::string:
    case Type::multiString: return value.isString();
    case Type::date:
    case Type::multiDate: return value.isDate();
    case Type::data: return value.isData();
    case Type::boolean: return value.type() == ValueType::boolean || value.isNumber();
    case Type::array: return value.isArray();
    case Type::multiDictionary: return value.isDictionary();
    case Type::multiAny: return value.isString() || value.isDictionary() || value.isDate();
    }
    return false;
}

bool isText(const Value& value) {
    return value.isString() && !value.string().empty();
}

// True for a multi-value that the cleaning would leave as it is.
bool isCleanMultiValue(const Dictionary& multi, CXPropertyType type) {
    const Value &values = multi["values"], &labels = multi["labels"], &identifiers = multi["identifiers"];
    if (multi.count() != 3 || !labels.isArray() || !identifiers.isArray()) return false;
    const Array &all = *values.arrayIf(), &ids = *identifiers.arrayIf(), &names = *labels.arrayIf();
    if (ids.count() != all.count() || names.count() != all.count()) return false;
    for (size_t i = 0; i < all.count(); ++i) {
        if (!isOfType(all[i], type) || !isText(ids[i]) || !names[i].isString()) return false;
        for (size_t j = 0; j < i; ++j)
            if (ids[j].string() == ids[i].string()) return false;
    }
    return true;
}

// The multi-value with the entries of the right kind; all entries when the kind is not known.
Value cleanMultiValue(const Value& value, std::optional<CXPropertyType> type, bool generateIdentifiers) {
    CXMutableMultiValue multi(*CXMultiValue::fromValue(value));
    for (size_t i = multi.count(); type && i-- > 0;)
        if (!isOfType(multi.valueAtIndex(i), *type)) multi.removeAtIndex(i);
    if (generateIdentifiers) multi.generateIdentifiers();
    return multi.toValue();
}

} // namespace

std::optional<CXPropertyType> cxPropertyType(std::string_view table, std::string_view property) {
    RecordKind kind = kindOfTable(table);
    if (kind == RecordKind::subscription) return typeIn(kSubscriptionOnly, property);
    if (auto any = typeIn(kAnyRecord, property)) return any;
    if (isPerson(kind)) return typeIn(kPersonOnly, property);
    if (isGroup(kind)) return typeIn(kGroupOnly, property);
    return std::nullopt;
}

namespace {

std::string carriable(const std::string& text) {
    std::string kept;
    for (std::string_view rest = text; !rest.empty();) {
        const std::string_view before = rest;
        const std::optional<char32_t> point = takeCodePoint(rest);
        if (!point) {
            appendUtf8(U'\uFFFD', kept);
            rest.remove_prefix(1);
        } else if (const auto one = before.substr(0, before.size() - rest.size()); !xmlTextFault(one)) {
            kept.append(one);
        }
    }
    return kept;
}

} // namespace

Value cxCarriableValue(const Value& value) {
    if (const std::string* text = value.stringIf()) return xmlTextFault(*text) ? Value(carriable(*text)) : value;
    if (const Array* items = value.arrayIf()) {
        Array copy;
        for (const Value& item : *items) copy.append(cxCarriableValue(item));
        return copy;
    }
    if (const Dictionary* entries = value.dictionaryIf()) {
        Dictionary copy;
        for (const auto& [key, item] : *entries)
            copy.set(xmlTextFault(key) ? carriable(key) : key, cxCarriableValue(item));
        return copy;
    }
    return value;
}

namespace {

bool isCarriable(const Value& value) {
    if (const std::string* text = value.stringIf()) return !xmlTextFault(*text);
    if (const Array* items = value.arrayIf()) return std::all_of(items->begin(), items->end(), isCarriable);
    if (const Dictionary* entries = value.dictionaryIf())
        return std::all_of(entries->begin(), entries->end(),
                           [](const auto& entry) { return !xmlTextFault(entry.first) && isCarriable(entry.second); });
    return true;
}

// Nearly every multi-value is as it should be; nothing is taken apart then.
Value sanitizedMultiValue(const Value& value, std::optional<CXPropertyType> type, bool generateIdentifiers) {
    constexpr size_t kMostEntries = 100; // of which identifiers are compared with one another
    if (type && !generateIdentifiers && value.dictionary()["values"].array().count() <= kMostEntries &&
        isCleanMultiValue(*value.dictionaryIf(), *type) && isCarriable(value))
        return value.deepMutableCopy();
    return cleanMultiValue(cxCarriableValue(value), type, generateIdentifiers);
}

} // namespace

Dictionary cxSanitizedProperties(std::string_view table, const Dictionary& dictionary, bool skipUnknownProperties,
                                 bool generateMultiValueIDs) {
    Dictionary result;
    for (const auto& [name, value] : dictionary) {
        if (name == kCXUIDProperty || name == kCXCreationDateProperty || name == kCXModificationDateProperty) continue;
        std::optional<CXPropertyType> type = cxPropertyType(table, name);
        if (skipUnknownProperties && !type) continue;
        bool isMultiValue = CXMultiValue::isMultiValue(value);
        bool fits = !type || (isMulti(*type) ? isMultiValue : isOfType(value, *type));
        if (skipUnknownProperties && !fits) continue;
        if (isMultiValue && (!type || isMulti(*type)))
            result.set(name,
                       sanitizedMultiValue(value, skipUnknownProperties ? type : std::nullopt, generateMultiValueIDs));
        else
            result.set(name, cxCarriableValue(value));
    }
    return result;
}

} // namespace rolvane
