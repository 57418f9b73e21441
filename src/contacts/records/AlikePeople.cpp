#include "contacts/records/AlikePeople.h"

#include "contacts/records/CXMerger.h"
#include "contacts/records/CXMultiValue.h"
#include "contacts/records/RecordKind.h"
#include "contacts/vcard/VCardText.h"

#include <algorithm>

namespace rolvane {

namespace {

constexpr size_t kComparedDigits = 9, kLeastDigits = 5;

std::string comparedNumber(const std::string& number) {
    std::string digits;
    for (const char c : number)
        if (c >= '0' && c <= '9') digits += c;
    if (digits.size() < kLeastDigits) return "";
    return digits.size() > kComparedDigits ? digits.substr(digits.size() - kComparedDigits) : digits;
}

// The person has all that the card has.
bool hasAllOf(const Dictionary& person, const Dictionary& card) {
    return CXMerger::merged(person, card) == person;
}

bool replacesNothing(const Dictionary& person, const Dictionary& card) {
    for (const auto& [key, value] : card) {
        const Value& own = person[key];
        if (own && own != value && !CXMultiValue::fromValue(own) && !own.isArray()) return false;
    }
    return true;
}

} // namespace

std::string cxComparedName(const std::string& displayName) {
    std::string out;
    for (const char c : foldCase(displayName)) {
        const bool blank = c == ' ' || c == '\t' || c == '\n';
        if (!blank)
            out += c;
        else if (!out.empty() && out.back() != ' ')
            out += ' ';
    }
    if (!out.empty() && out.back() == ' ') out.pop_back();
    return out;
}

std::set<std::string> cxReachedBy(const Dictionary& person) {
    std::set<std::string> all;
    if (const auto mails = CXMultiValue::fromValue(person[kCXEmailProperty]))
        for (const auto& entry : mails->entries())
            if (const std::string mail(vcardTrim(entry.value.string())); !mail.empty()) all.insert(vcardLower(mail));
    if (const auto phones = CXMultiValue::fromValue(person[kCXPhoneProperty]))
        for (const auto& entry : phones->entries())
            if (std::string number = comparedNumber(entry.value.string()); !number.empty()) all.insert(number);
    return all;
}

bool cxShareAny(const std::set<std::string>& a, const std::set<std::string>& b) {
    return std::any_of(a.begin(), a.end(), [&](const std::string& each) { return b.contains(each); });
}

CXAlikeness cxAlikeness(const Dictionary& a, const Dictionary& b) {
    const bool named = cxComparedName(cxDisplayName(a)) == cxComparedName(cxDisplayName(b));
    const bool reached = cxShareAny(cxReachedBy(a), cxReachedBy(b));
    if (named && (reached || hasAllOf(a, b) || hasAllOf(b, a))) return CXAlikeness::same;
    return named ? CXAlikeness::named : reached ? CXAlikeness::reached : CXAlikeness::none;
}

void CardOwnerFinder::load() {
    if (std::exchange(_loaded, true)) return;
    for (const auto& listing : _rolvane.listPeople(RemoteLocation("")))
        _byName[cxComparedName(listing.displayName)].push_back(listing.uniqueId);
}

void CardOwnerFinder::note(const CXPerson& person) {
    if (!_loaded) return; // loading will find it
    auto& all = _byName[cxComparedName(person.displayName())];
    if (std::find(all.begin(), all.end(), person.uniqueId()) == all.end()) all.push_back(person.uniqueId());
}

CardOwnerFinder::Found CardOwnerFinder::find(const Dictionary& card, const std::set<UniqueId>& inThisImport) {
    load();
    Found found;
    const auto named = _byName.find(cxComparedName(cxDisplayName(card)));
    if (named == _byName.end()) return found;
    const auto reached = cxReachedBy(card);
    std::vector<CXPersonRef> reachable;
    for (const UniqueId& uid : named->second) {
        const auto person = std::dynamic_pointer_cast<CXPerson>(_rolvane.recordForUniqueId(uid));
        if (!person) continue;
        const Dictionary own = person->dictionaryRepresentation();
        found.another = true;
        if (hasAllOf(own, card)) return {person, true};
        const bool usable = !inThisImport.contains(uid) || replacesNothing(own, card);
        if (usable && cxShareAny(reached, cxReachedBy(own))) reachable.push_back(person);
    }
    if (reachable.size() == 1) found.person = reachable.front();
    return found;
}

} // namespace rolvane
