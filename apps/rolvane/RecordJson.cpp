#include "RecordJson.h"

#include "SafeText.h"
#include "Subscriptions.h"
#include "Texts.h"

#include "contacts/records/Constants.h"
#include "contacts/vcard/VCardFields.h"
#include "foundation/Base64.h"

#include <algorithm>
#include <array>
#include <fmt/format.h>
#include <utility>

namespace rolvane::cli {

using Json = nlohmann::ordered_json;

Json toJson(const Value& value) {
    switch (value.type()) {
    case ValueType::absent: return nullptr;
    case ValueType::boolean: return value.boolean();
    case ValueType::integer: return value.integer();
    case ValueType::real: return value.real();
    case ValueType::string: return value.string();
    case ValueType::date: return value.date()->toISO8601();
    case ValueType::data: {
        std::string text;
        appendBase64(value.data().data(), value.data().size(), text);
        return text;
    }
    case ValueType::array: {
        Json array = Json::array();
        for (const Value& item : *value.arrayIf()) array.push_back(toJson(item));
        return array;
    }
    case ValueType::dictionary: {
        Json object = Json::object();
        for (const auto& [key, item] : *value.dictionaryIf()) object[key] = toJson(item);
        return object;
    }
    }
    return nullptr;
}

namespace {

Json locationOf(const CXRecord& record) {
    return record.remoteLocation().empty() ? Json() : Json(record.remoteLocation().str());
}

Json identifiers(const std::vector<UniqueId>& uids) {
    Json list = Json::array();
    for (const UniqueId& uid : uids) list.push_back(uid.str());
    return list;
}

} // namespace

Json ownerJson(const RemoteLocation& location) {
    return location.empty() ? Json() : Json(publisherOf(location));
}

std::string fromText(const CXRecord& record) {
    return tr("{}, at {} ({})", publisherOf(record.remoteLocation()), record.remoteLocation().str(),
              record.isWritable() ? translated("may be changed") : translated("read only"));
}

Json toJson(CXPerson& person) {
    Json groups = Json::array();
    for (const CXGroupRef& group : person.parentGroups()) groups.push_back(group->name());
    return {{"identifier", person.uniqueId().str()},
            {"name", person.displayName()},
            {"location", locationOf(person)},
            {"owner", ownerJson(person.remoteLocation())},
            {"created", toJson(person.valueForProperty(kCXCreationDateProperty))},
            {"modified", toJson(person.valueForProperty(kCXModificationDateProperty))},
            {"groups", groups},
            {"properties", toJson(Value(person.dictionaryRepresentation()))}};
}

namespace {

void appendJson(std::string& out, std::string_view text) {
    const bool plain =
        std::all_of(text.begin(), text.end(), [](char c) { return c >= ' ' && c < '\x7F' && c != '"' && c != '\\'; });
    if (plain)
        (out += '"').append(text) += '"';
    else
        out += Json(text).dump(-1, ' ', false, Json::error_handler_t::replace);
}

void appendJson(std::string& out, const Value& value) {
    if (const std::string* text = value.stringIf()) return appendJson(out, std::string_view(*text));
    const char* separator = "";
    if (const Array* array = value.arrayIf()) {
        out += '[';
        for (const Value& item : *array) {
            out += std::exchange(separator, ",");
            appendJson(out, item);
        }
        out += ']';
    } else if (const Dictionary* object = value.dictionaryIf()) {
        out += '{';
        for (const auto& [key, item] : *object) {
            out += std::exchange(separator, ",");
            appendJson(out, std::string_view(key));
            out += ':';
            appendJson(out, item);
        }
        out += '}';
    } else if (value.isData()) {
        out += '"';
        appendBase64(value.data().data(), value.data().size(), out);
        out += '"';
    } else {
        out += toJson(value).dump();
    }
}

} // namespace

std::string jsonText(const CXRow& row, const Dictionary& properties, const std::vector<std::string>& groups) {
    std::string out;
    const auto field = [&](const char* name, const Value& value) {
        ((out += out.empty() ? "{\"" : ",\"") += name) += "\":";
        appendJson(out, value);
    };
    field("identifier", row.uniqueId.str());
    field("name", cxDisplayName(properties));
    field("location", row.location.empty() ? Value() : Value(row.location.str()));
    out += ",\"owner\":" + ownerJson(row.location).dump();
    field("created", row.created);
    field("modified", row.modified);
    Array names;
    for (const std::string& group : groups) names.append(group);
    field("groups", names);
    field("properties", properties);
    return out += '}';
}

Json toJson(CXGroup& group) {
    Json choices = Json::object();
    for (const auto& [person, chosen] : group.distributionChoices())
        for (const auto& [property, identifier] : chosen) choices[person.str()][property] = identifier;
    Json published = Json::array();
    if (const auto locations = group.multiValueForProperty(kCXRemoteLocationProperty))
        for (const CXMultiValue::Entry& entry : locations->entries())
            if (entry.label == kCXPublishLabel) published.push_back(entry.value.string());
    return {{"identifier", group.uniqueId().str()},
            {"name", group.name()},
            {"location", locationOf(group)},
            {"owner", ownerJson(group.remoteLocation())},
            {"published", published},
            {"members", identifiers(group.memberUniqueIds())},
            {"subgroups", identifiers(group.subgroupUniqueIds())},
            {"distribution", choices}};
}

namespace {

constexpr std::array<std::pair<const char*, const char*>, 14> kSingles{{
    {kCXTitleProperty, marked("Title")},
    {kCXNicknameProperty, marked("Nickname")},
    {kCXMaidenNameProperty, marked("Maiden name")},
    {kCXFirstNamePhoneticProperty, marked("First, phonetic")},
    {kCXLastNamePhoneticProperty, marked("Last, phonetic")},
    {kCXOrganizationProperty, marked("Organisation")},
    {kCXDepartmentProperty, marked("Department")},
    {kCXJobTitleProperty, marked("Job title")},
    {kCXBirthdayProperty, marked("Birthday")},
    {kCXBirthdayTextProperty, marked("Birthday")},
    {kCXHomePageProperty, marked("Home page")},
    {kCXCategoriesProperty, marked("Categories")},
    {kCXPhotoProperty, marked("Photo")},
    {kCXNoteProperty, marked("Note")},
}};
constexpr std::array<std::pair<const char*, const char*>, 7> kMultis{{
    {kCXPhoneProperty, marked("Phone")},
    {kCXEmailProperty, marked("Email")},
    {kCXAddressProperty, marked("Address")},
    {kCXURLsProperty, marked("URLs")},
    {kCXInstantMessageProperty, marked("InstantMessage")},
    {kCXRelatedNamesProperty, marked("RelatedNames")},
    {kCXOtherDatesProperty, marked("OtherDates")},
}};

constexpr std::array<const char*, 12> kMonths{marked("January"), marked("February"), marked("March"),
                                              marked("April"),   marked("May"),      marked("June"),
                                              marked("July"),    marked("August"),   marked("September"),
                                              marked("October"), marked("November"), marked("December")};

std::string dayOfYear(int month, int day) {
    const char* name = translated(kMonths.at(static_cast<size_t>(month - 1)));
    return tr("{} {}", day, name); // a day and its month
}

// A day as people write it where its year is not known: of such a date 1604 is the filling.
std::string dayText(const std::string& iso) {
    const bool filled = iso.size() == 10 && iso.starts_with("1604-");
    return filled ? dayOfYear(std::stoi(iso.substr(5, 2)), std::stoi(iso.substr(8, 2))) : shownDay(iso);
}

// A birthday without its year, or with it alone, as vCards write it ("--0517", "1985-05").
std::string birthdayText(const std::string& text) {
    if (const std::string day = vcardDayOfYear(text); !day.empty())
        return dayOfYear(std::stoi(day.substr(2, 2)), std::stoi(day.substr(4, 2)));
    if (!vcardIsTruncatedDate(text) || text.size() != 7) return text;
    const int month = std::stoi(text.substr(5));
    if (month < 1 || month > 12) return text;
    return fmt::format("{} {}", translated(kMonths.at(static_cast<size_t>(month - 1))), text.substr(0, 4));
}

} // namespace

std::string oneLine(const Value& value) {
    if (const Dictionary* parts = value.dictionaryIf()) {
        std::string text;
        for (const char* key : {kCXAddressPOBoxKey, kCXAddressExtendedKey, kCXAddressStreetKey, kCXAddressZIPKey,
                                kCXAddressCityKey, kCXAddressStateKey, kCXAddressCountryKey})
            if (const std::string& part = (*parts)[key].string(); !part.empty())
                text += (text.empty() ? "" : ", ") + part;
        return text.empty() ? value.description() : text;
    }
    if (const Array* list = value.arrayIf()) {
        std::string text;
        for (const Value& item : *list) text += (text.empty() ? "" : ", ") + oneLine(item);
        return text;
    }
    if (value.isData()) return tr("{} bytes", value.data().size());
    if (value.isDate()) return dayText(value.date()->toISO8601().substr(0, 10));
    return value.description();
}

namespace {

void addLine(std::string& text, const std::string& label, const std::string& value) {
    std::string shown;
    for (const char c : value) {
        shown += c;
        if (c == '\n') shown += std::string(18, ' ');
    }
    constexpr size_t kColumn = 18;
    text += label + std::string(kColumn - std::min(kColumn - 1, columnsOf(label)), ' ') + shown + "\n";
}

} // namespace

std::string personText(CXPerson& person) {
    std::string text = shownLine(person.displayName()) + "\n";
    addLine(text, translated("Identifier"), person.uniqueId().str());
    if (!person.remoteLocation().empty()) addLine(text, translated("From"), fromText(person));
    for (const auto& [property, label] : kSingles)
        if (const Value value = person.valueForProperty(property)) {
            const bool isBirthday = property == std::string_view(kCXBirthdayTextProperty);
            addLine(text, translated(label), isBirthday ? birthdayText(value.string()) : oneLine(value));
        }
    for (const auto& [property, label] : kMultis)
        if (const auto values = person.multiValueForProperty(property))
            for (const CXMultiValue::Entry& entry : values->entries())
                addLine(text,
                        entry.label.empty() ? translated(label)
                                            : fmt::format("{} ({})", translated(label), entry.label),
                        oneLine(entry.value));
    std::string groups;
    for (const CXGroupRef& group : person.parentGroups()) groups += (groups.empty() ? "" : ", ") + group->name();
    if (!groups.empty()) addLine(text, translated("Groups"), groups);
    text.pop_back();
    return text;
}

} // namespace rolvane::cli
