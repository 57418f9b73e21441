#include "PersonFields.h"

#include "Context.h"
#include "Texts.h"
#include "ValueNames.h"

#include "contacts/records/Constants.h"
#include "foundation/Paths.h"

#include <algorithm>
#include <array>
#include <fmt/format.h>

namespace rolvane::cli {

namespace {

constexpr size_t kMaxPhotoBytes = 8u << 20;

// "work:+49 30 1234" -> label and value. Known labels fold letter case; a text without a label has the label Other,
// and so has one whose first colon belongs to the value ("https://…").
std::pair<std::string, std::string> labelled(const std::string& text) {
    const size_t colon = text.find(':');
    if (colon == std::string::npos || colon == 0 || text.compare(colon, 3, "://") == 0) return {kCXOtherLabel, text};
    const std::string label = text.substr(0, colon);
    for (const char* known : {kCXHomeLabel, kCXWorkLabel, kCXMobileLabel, kCXMainLabel, kCXHomeFaxLabel,
                              kCXWorkFaxLabel, kCXPagerLabel, kCXHomePageLabel, kCXOtherLabel})
        if (std::equal(label.begin(), label.end(), known, known + std::string_view(known).size(),
                       [](char a, char b) { return std::tolower(a) == std::tolower(b); }))
            return {known, text.substr(colon + 1)};
    return {label, text.substr(colon + 1)};
}

// "Street; ZIP City; State; Country", each part but the first may be missing.
Value addressFrom(const std::string& text) {
    static constexpr std::array<const char*, 5> kKeys{kCXAddressStreetKey, kCXAddressZIPKey, kCXAddressCityKey,
                                                      kCXAddressStateKey, kCXAddressCountryKey};
    Dictionary address;
    size_t from = 0, part = 0;
    while (from <= text.size() && part < kKeys.size()) {
        const size_t end = std::min(text.find(';', from), text.size());
        std::string value = text.substr(from, end - from);
        value.erase(0, value.find_first_not_of(' '));
        value.erase(value.find_last_not_of(' ') + 1);
        if (!value.empty()) address.set(kKeys[part], value);
        from = end + 1;
        ++part;
    }
    if (address.empty())
        throw CommandError(kUsage,
                           tr("\"{}\" is no address. Write \"label:Street; ZIP; City; State; Country\".", text));
    return address;
}

void removeValues(CXMutableMultiValue& values, const std::vector<std::string>& unwanted, const char* property) {
    for (const std::string& text : unwanted) {
        const auto& entries = values.entries();
        const auto found = std::find_if(entries.begin(), entries.end(), [&](const CXMultiValue::Entry& e) {
            return e.identifier == text || e.label == text || e.value.string() == text;
        });
        if (found == entries.end())
            throw CommandError(kNotFound, tr("There is no {} \"{}\" to remove.", property, text));
        values.removeAtIndex(static_cast<size_t>(found - entries.begin()));
    }
}

struct Change {
    std::string property;
    Value value; // absent: removed
};

void changeMulti(std::vector<Change>& changes, const CXPerson& person, const char* property,
                 const std::vector<std::string>& added, const std::vector<std::string>& removed, bool addresses) {
    if (added.empty() && removed.empty()) return;
    CXMutableMultiValue values(person.multiValueForProperty(property).value_or(CXMultiValue()));
    removeValues(values, removed, property);
    for (const std::string& text : added) {
        const auto [label, value] = labelled(text);
        values.addValue(addresses ? addressFrom(value) : Value(value), label);
    }
    changes.push_back({property, values.empty() ? Value() : values.toValue()});
}

Value birthdayFrom(const std::string& text) {
    const auto date = Date::fromISO8601(text + "T00:00:00Z");
    if (!date) throw CommandError(kUsage, tr("\"{}\" is no date. Write it as 1980-12-31.", text));
    return *date;
}

const char* imageType(const std::string& bytes) {
    if (bytes.starts_with("\x89PNG\r\n\x1a\n")) return "image/png";
    if (bytes.starts_with("\xff\xd8\xff")) return "image/jpeg";
    if (bytes.starts_with("GIF8")) return "image/gif";
    if (bytes.size() > 12 && bytes.compare(8, 4, "WEBP") == 0) return "image/webp";
    return nullptr;
}

} // namespace

const std::vector<PersonFields::Single>& PersonFields::singles() {
    static const std::vector<Single> all{
        {"--first", kCXFirstNameProperty, translated("First name")},
        {"--middle", kCXMiddleNameProperty, translated("Middle name")},
        {"--last", kCXLastNameProperty, translated("Last name")},
        {"--prefix", kCXTitleProperty, translated("Title before the name")},
        {"--suffix", kCXSuffixProperty, translated("Suffix behind the name")},
        {"--nickname", kCXNicknameProperty, translated("Nickname")},
        {"--org", kCXOrganizationProperty, translated("Organisation")},
        {"--department", kCXDepartmentProperty, translated("Department")},
        {"--title", kCXJobTitleProperty, translated("Job title")},
        {"--note", kCXNoteProperty, translated("Note")},
        {"--home-page", kCXHomePageProperty, translated("Home page")},
    };
    return all;
}

void PersonFields::declare(CLI::App& command, bool editing) {
    values.resize(singles().size());
    for (size_t i = 0; i < singles().size(); ++i)
        given.push_back(command.add_option(singles()[i].option, values[i], singles()[i].help));
    command.add_option("--birthday", birthday, "Birthday, as 1980-12-31");
    command.add_option("--photo", photo, "File with a PNG, JPEG, GIF or WebP picture")->type_name(kFileValue);
    // One value each time that the option is given: what follows the value is not taken for another one.
    const auto several = [&](const char* name, std::vector<std::string>& texts, const char* help) {
        command.add_option(name, texts, help)->allow_extra_args(false);
    };
    several("--phone", phones, "Add a phone number, as label:number");
    several("--email", emails, "Add a mail address, as label:address");
    several("--url", urls, "Add a URL, as label:URL");
    several("--address", addresses, "Add an address, as \"label:Street; ZIP; City; State; Country\"");
    if (!editing) return;
    several("--remove-phone", removedPhones, "Remove a phone number, by value, label or identifier");
    several("--remove-email", removedEmails, "Remove a mail address");
    several("--remove-url", removedUrls, "Remove a URL");
    several("--remove-address", removedAddresses, "Remove an address, by label or identifier");
    several("--unset", unset, "Remove a property, by its name in `show --json`");
}

void PersonFields::applyTo(CXPerson& person) const {
    std::vector<Change> changes; // all is understood before anything is changed
    for (size_t i = 0; i < singles().size(); ++i)
        if (given[i]->count() > 0)
            changes.push_back({singles()[i].property, values[i].empty() ? Value() : Value(values[i])});
    if (!birthday.empty()) changes.push_back({kCXBirthdayProperty, birthdayFrom(birthday)});
    if (!photo.empty()) {
        const std::string bytes = readFile(photo, kMaxPhotoBytes);
        const char* type = imageType(bytes);
        if (!type) throw CommandError(kUsage, tr("{} is no PNG, JPEG, GIF or WebP picture.", photo));
        changes.push_back({kCXPhotoProperty, Bytes(bytes.begin(), bytes.end())});
        changes.push_back({kCXPhotoTypeProperty, type});
    }
    changeMulti(changes, person, kCXPhoneProperty, phones, removedPhones, false);
    changeMulti(changes, person, kCXEmailProperty, emails, removedEmails, false);
    changeMulti(changes, person, kCXURLsProperty, urls, removedUrls, false);
    changeMulti(changes, person, kCXAddressProperty, addresses, removedAddresses, true);
    for (const std::string& property : unset) {
        if (person.valueForProperty(property).isAbsent())
            throw CommandError(kNotFound, tr("{} has no property {}.", person.displayName(), property));
        changes.push_back({property, Value()});
    }
    for (const Change& change : changes) // what stays as it was is no edit, which would travel to everybody
        if (!(person.valueForProperty(change.property) == change.value)) person.setValue(change.value, change.property);
}

} // namespace rolvane::cli
