#include "contacts/vcard/TableColumns.h"

#include "contacts/records/Constants.h"
#include "contacts/vcard/VCardText.h"

#include <algorithm>
#include <map>

namespace rolvane {

namespace {

using Kind = ColumnKind;

Column text(const char* property) {
    return {Kind::text, property, "", "", 0};
}
Column entry(const char* property, const char* label) {
    return {Kind::entry, property, label, "", 0};
}
Column address(const char* label, const char* key) {
    return {Kind::addressPart, kCXAddressProperty, label, key, 0};
}
Column of(Kind kind, const char* property = "") {
    return {kind, property, "", "", 0};
}

// The parts of an address under the names that programs give them: "Home Street", "Home: City".
void addAddresses(std::map<std::string, Column>& all) {
    struct Place {
        const char *word, *label;
    };
    struct Part {
        const char *word, *key;
    };
    for (const auto& [place, label] : {Place{"home", kCXHomeLabel}, Place{"business", kCXWorkLabel},
                                       Place{"work", kCXWorkLabel}, Place{"other", kCXOtherLabel}})
        for (const auto& [part, key] :
             {Part{"street", kCXAddressStreetKey}, Part{"address", kCXAddressStreetKey},
              Part{"street 2", kCXAddressStreetKey}, Part{"street 3", kCXAddressStreetKey},
              Part{"address 2", kCXAddressStreetKey}, Part{"address po box", kCXAddressPOBoxKey},
              Part{"po box", kCXAddressPOBoxKey}, Part{"city", kCXAddressCityKey}, Part{"state", kCXAddressStateKey},
              Part{"postal code", kCXAddressZIPKey}, Part{"zipcode", kCXAddressZIPKey},
              Part{"country/region", kCXAddressCountryKey}, Part{"country", kCXAddressCountryKey}})
            all[std::string(place) + " " + part] = address(label, key);
}

void addNames(std::map<std::string, Column>& all) {
    for (const char* h : {"first name", "given name", "vorname"}) all[h] = text(kCXFirstNameProperty);
    for (const char* h : {"last name", "family name", "surname", "nachname"}) all[h] = text(kCXLastNameProperty);
    for (const char* h : {"middle name", "additional name", "weitere vornamen"}) all[h] = text(kCXMiddleNameProperty);
    for (const char* h : {"title", "name prefix", "anrede"}) all[h] = text(kCXTitleProperty);
    for (const char* h : {"suffix", "name suffix"}) all[h] = text(kCXSuffixProperty);
    for (const char* h : {"display name", "name", "file as", "anzeigename"}) all[h] = text(kCXFormattedNameProperty);
    for (const char* h : {"nickname", "nick name", "spitzname"}) all[h] = text(kCXNicknameProperty);
    for (const char* h : {"given name yomi", "phonetic first name"}) all[h] = text(kCXFirstNamePhoneticProperty);
    for (const char* h : {"family name yomi", "phonetic last name"}) all[h] = text(kCXLastNamePhoneticProperty);
    for (const char* h : {"additional name yomi", "phonetic middle name"}) all[h] = text(kCXMiddleNamePhoneticProperty);
    all["maiden name"] = text(kCXMaidenNameProperty);
    for (const char* h : {"company", "organization", "organization name", "firma", "organization 1 - name"})
        all[h] = text(kCXOrganizationProperty);
    for (const char* h : {"department", "organization department", "abteilung", "organization 1 - department"})
        all[h] = text(kCXDepartmentProperty);
    for (const char* h : {"job title", "organization title", "position", "organization 1 - title"})
        all[h] = text(kCXJobTitleProperty);
}

void addEntries(std::map<std::string, Column>& all) {
    struct Named {
        const char *header, *property, *label;
    };
    for (const auto& [header, property, label] : {Named{"e-mail address", kCXEmailProperty, ""},
                                                  {"e-mail 2 address", kCXEmailProperty, ""},
                                                  {"e-mail 3 address", kCXEmailProperty, ""},
                                                  {"e-mail-adresse", kCXEmailProperty, ""},
                                                  {"primary email", kCXEmailProperty, ""},
                                                  {"secondary email", kCXEmailProperty, ""},
                                                  {"email", kCXEmailProperty, ""},
                                                  {"e-mail", kCXEmailProperty, ""},
                                                  {"screen name", kCXInstantMessageProperty, ""},
                                                  {"phone", kCXPhoneProperty, ""},
                                                  {"home phone", kCXPhoneProperty, kCXHomeLabel},
                                                  {"home phone 2", kCXPhoneProperty, kCXHomeLabel},
                                                  {"telefon privat", kCXPhoneProperty, kCXHomeLabel},
                                                  {"business phone", kCXPhoneProperty, kCXWorkLabel},
                                                  {"business phone 2", kCXPhoneProperty, kCXWorkLabel},
                                                  {"work phone", kCXPhoneProperty, kCXWorkLabel},
                                                  {"telefon geschäftlich", kCXPhoneProperty, kCXWorkLabel},
                                                  {"mobile phone", kCXPhoneProperty, kCXMobileLabel},
                                                  {"mobile number", kCXPhoneProperty, kCXMobileLabel},
                                                  {"mobiltelefon", kCXPhoneProperty, kCXMobileLabel},
                                                  {"company main phone", kCXPhoneProperty, kCXMainLabel},
                                                  {"home fax", kCXPhoneProperty, kCXHomeFaxLabel},
                                                  {"business fax", kCXPhoneProperty, kCXWorkFaxLabel},
                                                  {"fax number", kCXPhoneProperty, kCXWorkFaxLabel},
                                                  {"pager", kCXPhoneProperty, kCXPagerLabel},
                                                  {"pager number", kCXPhoneProperty, kCXPagerLabel},
                                                  {"other phone", kCXPhoneProperty, kCXOtherLabel},
                                                  {"other fax", kCXPhoneProperty, "Fax"},
                                                  {"car phone", kCXPhoneProperty, "Car"},
                                                  {"assistant's phone", kCXPhoneProperty, "Assistant"},
                                                  {"callback", kCXPhoneProperty, "Callback"},
                                                  {"isdn", kCXPhoneProperty, "ISDN"},
                                                  {"primary phone", kCXPhoneProperty, kCXMainLabel},
                                                  {"radio phone", kCXPhoneProperty, "Radio"},
                                                  {"tty/tdd phone", kCXPhoneProperty, "Textphone"},
                                                  {"telex", kCXPhoneProperty, "Telex"},
                                                  {"web page", kCXURLsProperty, ""},
                                                  {"web page 1", kCXURLsProperty, kCXWorkLabel},
                                                  {"web page 2", kCXURLsProperty, kCXHomeLabel},
                                                  {"personal web page", kCXURLsProperty, kCXHomeLabel},
                                                  {"business web page", kCXURLsProperty, kCXWorkLabel},
                                                  {"assistant's name", kCXRelatedNamesProperty, "Assistant"},
                                                  {"manager's name", kCXRelatedNamesProperty, "Manager"},
                                                  {"spouse", kCXRelatedNamesProperty, "Spouse"},
                                                  {"children", kCXRelatedNamesProperty, "Child"}})
        all[header] = entry(property, label);
}

const std::map<std::string, Column>& knownColumns() {
    static const std::map<std::string, Column> known = [] {
        std::map<std::string, Column> all;
        addNames(all);
        addEntries(all);
        addAddresses(all);
        for (const char* h : {"notes", "note", "notizen"}) all[h] = of(Kind::note);
        for (const char* h : {"birthday", "geburtstag"}) all[h] = of(Kind::date, kCXBirthdayProperty);
        all["anniversary"] = {Kind::dateEntry, kCXOtherDatesProperty, kCXAnniversaryLabel, "", 0};
        all["birth year"] = of(Kind::birthYear);
        all["birth month"] = of(Kind::birthMonth);
        all["birth day"] = of(Kind::birthDay);
        for (const char* h : {"categories", "group membership", "labels", "kategorien"}) all[h] = of(Kind::categories);
        for (const char* h : {"e-mail type", "e-mail 2 type", "e-mail 3 type", "e-mail display name",
                              "e-mail 2 display name", "e-mail 3 display name", "organization 1 - type"})
            all[h] = of(Kind::saysNothing);
        return all;
    }();
    return known;
}

struct NumberedKind {
    const char *start, *property;
};
constexpr NumberedKind kNumbered[] = {{"e-mail", kCXEmailProperty},          {"phone", kCXPhoneProperty},
                                      {"website", kCXURLsProperty},          {"im", kCXInstantMessageProperty},
                                      {"relation", kCXRelatedNamesProperty}, {"event", kCXOtherDatesProperty},
                                      {"address", kCXAddressProperty}};

// "E-mail 2 - Value", "Address 1 - Postal Code".
Column numberedColumn(const std::string& header) {
    const size_t dash = header.find(" - ");
    const size_t blank = dash == std::string::npos ? dash : header.rfind(' ', dash - 1);
    if (dash == std::string::npos || blank == std::string::npos) return {};
    const std::string start = header.substr(0, blank), number = header.substr(blank + 1, dash - blank - 1);
    const std::string part = header.substr(dash + 3);
    const bool counted = !number.empty() && number.size() < 4 &&
                         std::all_of(number.begin(), number.end(), [](char c) { return c >= '0' && c <= '9'; });
    if (!counted) return {};
    for (const auto& [name, property] : kNumbered) {
        if (start != name) continue;
        Column column{Kind::unknown, property, "", "", std::stoi(number)};
        if (part == "value") column.kind = Kind::entryValue;
        if (part == "type" || part == "label") column.kind = Kind::entryLabel;
        if (property != std::string(kCXAddressProperty) || column.kind != Kind::unknown) return column;
        if (part == "formatted") return of(Kind::saysNothing);
        static const std::map<std::string, const char*> parts{{"street", kCXAddressStreetKey},
                                                              {"city", kCXAddressCityKey},
                                                              {"po box", kCXAddressPOBoxKey},
                                                              {"region", kCXAddressStateKey},
                                                              {"postal code", kCXAddressZIPKey},
                                                              {"country", kCXAddressCountryKey},
                                                              {"extended address", kCXAddressExtendedKey}};
        const auto found = parts.find(part);
        if (found == parts.end()) return {};
        column.kind = Kind::addressPart;
        column.key = found->second;
        return column;
    }
    return {};
}

} // namespace

Column columnOf(const std::string& header) {
    std::string name = vcardLower(std::string(vcardTrim(header)));
    const auto found = knownColumns().find(name);
    if (found != knownColumns().end()) return found->second;
    return numberedColumn(name);
}

bool isHeaderOfPeople(const std::vector<std::string>& header) {
    size_t known = 0;
    bool names = false;
    for (const std::string& cell : header) {
        const Column column = columnOf(cell);
        if (column.kind == Kind::unknown) continue;
        known++;
        names = names || column.property == kCXFirstNameProperty || column.property == kCXLastNameProperty ||
                column.property == kCXFormattedNameProperty || column.property == kCXEmailProperty;
    }
    return names && known >= 2 && known * 2 >= header.size();
}

std::string labelOfCell(const std::string& cell) {
    std::string word(vcardTrim(cell));
    if (word.starts_with("* ")) word.erase(0, 2); // the preferred one
    static const std::map<std::string, const char*> known{{"home", kCXHomeLabel},
                                                          {"work", kCXWorkLabel},
                                                          {"mobile", kCXMobileLabel},
                                                          {"main", kCXMainLabel},
                                                          {"home fax", kCXHomeFaxLabel},
                                                          {"homefax", kCXHomeFaxLabel},
                                                          {"workfax", kCXWorkFaxLabel},
                                                          {"work fax", kCXWorkFaxLabel},
                                                          {"pager", kCXPagerLabel},
                                                          {"other", kCXOtherLabel},
                                                          {"anniversary", kCXAnniversaryLabel},
                                                          {"*", ""}};
    const auto found = known.find(vcardLower(word));
    return found == known.end() ? word : found->second;
}

} // namespace rolvane
