#include "contacts/records/CXPerson.h"

#include "contacts/database/RolvaneImpl.h"

namespace rolvane {

namespace {

std::string joined(const Dictionary& properties, std::initializer_list<const char*> keys) {
    std::string text;
    for (const char* key : keys) {
        const std::string& part = properties[key].string();
        if (part.empty()) continue;
        if (!text.empty()) text += ' ';
        text += part;
    }
    return text;
}

std::string firstOf(const Value& value) {
    auto multi = CXMultiValue::fromValue(value);
    if (!multi) return {};
    for (const auto& e : multi->entries())
        if (!e.value.string().empty()) return e.value.string();
    return {};
}

} // namespace

std::string cxDisplayName(const Dictionary& properties) {
    for (std::string text :
         {properties[kCXIsCompanyProperty].boolean() ? properties[kCXOrganizationProperty].string() : std::string(),
          properties[kCXFormattedNameProperty].string(),
          joined(properties, {kCXFirstNameProperty, kCXMiddleNameProperty, kCXLastNameProperty}),
          properties[kCXOrganizationProperty].string(), properties[kCXNicknameProperty].string(),
          firstOf(properties[kCXEmailProperty]), firstOf(properties[kCXPhoneProperty])})
        if (!text.empty()) return text;
    return "(no name)";
}

CXPersonRef CXPerson::create() {
    return initWithUniqueId(makeUniqueId(kCXPersonTable));
}

CXPersonRef CXPerson::initWithUniqueId(const UniqueId& uid) {
    if (cxTableName(uid) == kCXSubscribedPersonTable) return CXSubscribedPerson::initWithUniqueId(uid);
    return CXPersonRef(new CXPerson(uid, Dictionary()));
}

CXPersonRef CXSubscribedPerson::initWithUniqueId(const UniqueId& uid) {
    return CXPersonRef(new CXSubscribedPerson(uid, Dictionary()));
}

CXPersonRef CXPerson::personFromDictionary(const Dictionary& dictionary, CXRolvane* rolvane, bool skipUnknownProperties,
                                           bool generateMultiValueIDs) {
    CXPersonRef person = create();
    person->resetWithDictionary(dictionary, skipUnknownProperties, generateMultiValueIDs);
    if (rolvane) rolvane->addRecord(person);
    return person;
}

CXSearchElement CXPerson::searchElementForProperty(std::string_view property, std::string_view label,
                                                   std::string_view key, Value value, int comparison) {
    return {std::string(kCXPersonTable),
            std::string(property),
            std::string(label),
            std::string(key),
            std::move(value),
            static_cast<CXSearchComparison>(comparison)};
}

CXSearchElement CXSubscribedPerson::searchElementForProperty(std::string_view property, std::string_view label,
                                                             std::string_view key, Value value, int comparison) {
    CXSearchElement element = CXPerson::searchElementForProperty(property, label, key, std::move(value), comparison);
    element.table = kCXSubscribedPersonTable;
    return element;
}

std::vector<UniqueId> CXPerson::parentGroupUniqueIds() const {
    CXRolvane* database = owner();
    if (!database) return {};
    std::lock_guard lock(database->impl().mutex);
    return database->impl().parents(uniqueId());
}

std::vector<CXGroupRef> CXPerson::parentGroups() const {
    CXRolvane* database = owner();
    if (!database) return {};
    std::lock_guard lock(database->impl().mutex);
    std::vector<CXGroupRef> groups;
    for (const UniqueId& uid : parentGroupUniqueIds())
        if (auto group = database->impl().handleAs<CXGroup>(uid)) groups.push_back(group);
    return groups;
}

std::string CXPerson::displayName() const {
    return cxDisplayName(dictionaryRepresentation());
}

} // namespace rolvane
