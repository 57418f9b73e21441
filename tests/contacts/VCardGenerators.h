#pragma once

#include "contacts/records/CXMultiValue.h"
#include "contacts/records/Constants.h"
#include "contacts/vcard/VCardReader.h"
#include "contacts/vcard/VCardWriter.h"

#include <gtest/gtest.h>
#include <rapidcheck/gtest.h>

#include <sstream>
#include <string>
#include <vector>

namespace rolvane::vcardtest {

inline void appendUTF8(std::string& out, uint32_t c) {
    auto tail = [&](int shift) { out += static_cast<char>(0x80 | (c >> shift & 63)); };
    if (c < 0x80)
        out += static_cast<char>(c);
    else if (c < 0x800)
        out += static_cast<char>(0xC0 | c >> 6), tail(0);
    else if (c < 0x10000)
        out += static_cast<char>(0xE0 | c >> 12), tail(6), tail(0);
    else
        out += static_cast<char>(0xF0 | c >> 18), tail(12), tail(6), tail(0);
}

// Any text of Unicode scalar values without control characters, rich in what vCards must escape.
inline rc::Gen<std::string> anyText() {
    auto scalar = rc::gen::oneOf(
        rc::gen::inRange<uint32_t>(0x20, 0x7F), rc::gen::inRange<uint32_t>(0xA0, 0x600),
        rc::gen::inRange<uint32_t>(0x900, 0xD7FF), rc::gen::inRange<uint32_t>(0x10000, 0x1FFFF),
        rc::gen::elementOf(std::vector<uint32_t>{'\n', '\\', ',', ';', ':', '"', '^', '\'', ' ', '=', '\t'}));
    return rc::gen::map(rc::gen::resize(25, rc::gen::container<std::vector<uint32_t>>(scalar)),
                        [](const std::vector<uint32_t>& cs) {
                            std::string out;
                            for (uint32_t c : cs) appendUTF8(out, c);
                            return out;
                        });
}

inline rc::Gen<std::string> someText() {
    return rc::gen::nonEmpty(anyText());
}

inline rc::Gen<std::string> anyLabel() {
    return rc::gen::oneOf(rc::gen::element<std::string>("Home", "Work", "Mobile", "Main", "HomeFax", "WorkFax", "Pager",
                                                        "Other", "", "Anniversary", "HomePage", "Car", "home", "Spouse",
                                                        "fax"),
                          anyText());
}

inline rc::Gen<Value> anyAddress() {
    return rc::gen::map(
        rc::gen::container<std::vector<std::pair<int, std::string>>>(rc::gen::pair(rc::gen::inRange(0, 9), someText())),
        [](const std::vector<std::pair<int, std::string>>& parts) {
            const char* keys[] = {kCXAddressStreetKey,  kCXAddressExtendedKey,    kCXAddressPOBoxKey,
                                  kCXAddressCityKey,    kCXAddressStateKey,       kCXAddressZIPKey,
                                  kCXAddressCountryKey, kCXAddressCountryCodeKey, "Planet"};
            Dictionary address;
            for (const auto& [key, text] : parts) address.set(keys[key], text);
            return Value(address);
        });
}

inline rc::Gen<Value> anyDate() {
    return rc::gen::map(rc::gen::pair(rc::gen::inRange<int64_t>(-60000000000, 250000000000), rc::gen::inRange(0, 4)),
                        [](const std::pair<int64_t, int>& d) {
                            double s = static_cast<double>(d.first);
                            if (d.second < 2) s = static_cast<double>(d.first / 86400 * 86400);
                            return Value(Date(d.second == 3 ? s + 0.5 : s));
                        });
}

inline void addMulti(Dictionary& person, const char* property, const rc::Gen<Value>& values) {
    int n = *rc::gen::inRange(0, 4);
    if (n == 0) return;
    CXMutableMultiValue multi;
    for (int i = 0; i < n; i++) multi.addValue(*values, *anyLabel());
    person.set(property, multi.toValue());
}

// Every property a person can have, with hostile texts.
inline Dictionary anyPerson() {
    Dictionary p;
    for (const char* key :
         {kCXFirstNameProperty, kCXLastNameProperty, kCXMiddleNameProperty, kCXTitleProperty, kCXSuffixProperty,
          kCXNicknameProperty, kCXMaidenNameProperty, kCXFirstNamePhoneticProperty, kCXMiddleNamePhoneticProperty,
          kCXLastNamePhoneticProperty, kCXFormattedNameProperty, kCXOrganizationProperty, kCXDepartmentProperty,
          kCXJobTitleProperty, kCXHomePageProperty, kCXBirthdayTextProperty, kCXNoteProperty})
        if (*rc::gen::inRange(0, 3) == 0) p.set(key, *someText());
    auto text = rc::gen::map(someText(), [](std::string s) { return Value(std::move(s)); });
    for (const char* key :
         {kCXPhoneProperty, kCXEmailProperty, kCXURLsProperty, kCXInstantMessageProperty, kCXRelatedNamesProperty})
        addMulti(p, key, text);
    addMulti(p, kCXAddressProperty, anyAddress());
    addMulti(p, kCXOtherDatesProperty, anyDate());
    if (*rc::gen::arbitrary<bool>()) p.set(kCXBirthdayProperty, *anyDate());
    if (*rc::gen::arbitrary<bool>()) p.set(kCXPhotoProperty, *rc::gen::nonEmpty<Bytes>());
    if (*rc::gen::arbitrary<bool>())
        p.set(kCXPhotoTypeProperty,
              *rc::gen::oneOf(rc::gen::element<std::string>("image/png", "image/JPEG", "x"), someText()));
    if (*rc::gen::arbitrary<bool>()) p.set(kCXIsCompanyProperty, *rc::gen::arbitrary<bool>());
    return p;
}

struct ReadBack {
    std::vector<VCardEntity> entities;
    std::vector<VCardError> errors;
};

inline ReadBack readText(const std::string& text) {
    ReadBack result;
    std::istringstream in(text);
    VCardScanner scanner(in, "text.vcf", [&](const VCardError& e) { result.errors.push_back(e); });
    while (auto card = scanner.next()) {
        VCardError error;
        if (auto entity = vcardEntityFromCard(*card, error))
            result.entities.push_back(std::move(*entity));
        else
            result.errors.push_back(error);
    }
    return result;
}

// One card of the lines.
inline ReadBack readCard(const std::string& lines, const std::string& version) {
    return readText("BEGIN:VCARD\r\nVERSION:" + version + "\r\n" + lines + "END:VCARD\r\n");
}

// A good one; else the test fails.
inline VCardEntity readOneCard(const std::string& lines, const std::string& version) {
    auto r = readCard(lines, version);
    for (const auto& e : r.errors) ADD_FAILURE() << e.description();
    return r.entities.size() == 1 ? r.entities[0] : VCardEntity{};
}

// Identifiers of multi-value entries belong to one database; everything else must be equal.
inline Dictionary withoutIdentifiers(const Dictionary& d) {
    Dictionary out;
    for (const auto& [key, value] : d) {
        Dictionary copy = value.deepMutableCopy().dictionary();
        if (CXMultiValue::isMultiValue(value))
            copy.remove("identifiers"), out.set(key, copy);
        else
            out.set(key, value);
    }
    return out;
}

} // namespace rolvane::vcardtest
