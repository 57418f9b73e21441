#include "server/mod_cardbook/CardMerge.h"

#include "contacts/records/CXMultiValue.h"
#include "contacts/records/CXPerson.h"
#include "server/mod_cardbook/CardText.h"

#include <algorithm>
#include <array>

namespace rolvane::cardbook {
namespace {

// The properties that every contacts program knows.
constexpr std::array kCommon = {kCXFirstNameProperty, kCXLastNameProperty,     kCXMiddleNameProperty,
                                kCXTitleProperty,     kCXSuffixProperty,       kCXFormattedNameProperty,
                                kCXNicknameProperty,  kCXOrganizationProperty, kCXDepartmentProperty,
                                kCXJobTitleProperty,  kCXBirthdayProperty,     kCXPhoneProperty,
                                kCXEmailProperty,     kCXAddressProperty,      kCXURLsProperty,
                                kCXNoteProperty,      kCXBirthdayTextProperty, kCXHomePageProperty};

bool isCommon(const std::string& name) {
    return std::any_of(kCommon.begin(), kCommon.end(), [&](const char* each) { return name == each; });
}

std::string lineKnowledge(const std::string& name) {
    return "line:" + name;
}

// Properties as a card of that version shows them.
Dictionary shownAs(const UniqueId& uid, const Dictionary& properties, bool version4) {
    const std::string text = personText(uid, properties, version4 ? VCardVersion::v4 : VCardVersion::v3);
    return readClientCard(text).entity.properties;
}

Dictionary stored(const Dictionary& properties) {
    return cxSanitizedProperties(kCXPersonTable, properties, true, false);
}

// Entries that are surely the same get the identifier that they have there: by label and value, then by value, then
// those that are left of a label.
Value withIdentifiersOf(const Value& theirs, const Value& ours) {
    const auto own = CXMultiValue::fromValue(ours), other = CXMultiValue::fromValue(theirs);
    if (!own || !other) return theirs;
    std::vector<CXMultiValue::Entry> left = own->entries(), all = other->entries();
    std::vector<bool> isNamed(all.size(), false);
    const auto take = [&](const auto& isSame) {
        for (size_t i = 0; i < all.size(); ++i) {
            if (isNamed[i]) continue;
            const auto found =
                std::find_if(left.begin(), left.end(), [&](const auto& entry) { return isSame(entry, all[i]); });
            if (found == left.end()) continue;
            all[i].identifier = found->identifier;
            isNamed[i] = true;
            left.erase(found);
        }
    };
    take([](const auto& a, const auto& b) { return a.label == b.label && a.value == b.value; });
    take([](const auto& a, const auto& b) { return a.value == b.value; });
    take([](const auto& a, const auto& b) { return a.label == b.label; });
    CXMutableMultiValue named;
    for (const auto& entry : all) named.addValue(entry.value, entry.label, entry.identifier);
    return named.toValue();
}

Dictionary aligned(const Dictionary& theirs, const Dictionary& ours) {
    Dictionary all;
    for (const auto& [name, value] : theirs)
        all.set(name, CXMultiValue::isMultiValue(value) ? withIdentifiersOf(value, ours[name]) : value);
    return all;
}

// The properties that the client left out without knowing of them.
Dictionary completed(const Dictionary& written, const Dictionary& had, const Knows& knows) {
    Dictionary all = written.mutableCopy();
    for (const auto& [name, value] : had)
        if (!all.contains(name) && name != kCXVCardExtraProperty && !isCommon(name) && !knows(name))
            all.set(name, value);
    const Array* lines = had[kCXVCardExtraProperty].arrayIf();
    if (!lines) return all;
    Array kept = all[kCXVCardExtraProperty].arrayIf() ? all[kCXVCardExtraProperty].array().mutableCopy() : Array();
    std::set<std::string> known;
    for (const Value& text : kept) known.insert(text.string());
    for (const Value& text : *lines) {
        if (text.string().starts_with('+') || known.contains(text.string())) continue;
        const auto line = vcardParseLine(text.string());
        if (!line || line->name == "UID" || knows(lineKnowledge(line->name))) continue;
        known.insert(text.string());
        kept.append(text);
    }
    if (!kept.empty()) all.set(kCXVCardExtraProperty, kept);
    return all;
}

bool isSame(const Value& a, const Value& b) {
    const auto left = CXMultiValue::fromValue(a), right = CXMultiValue::fromValue(b);
    return left && right ? left->sameContents(*right) : a == b;
}

} // namespace

std::set<std::string> knowledgeOf(const ClientCard& card) {
    std::set<std::string> all;
    for (const auto& [name, value] : card.entity.properties)
        if (!isCommon(name) && name != kCXVCardExtraProperty) all.insert(name);
    if (const Array* lines = card.entity.properties[kCXVCardExtraProperty].arrayIf())
        for (const Value& text : *lines)
            if (const auto line = text.string().starts_with('+') ? std::nullopt : vcardParseLine(text.string()))
                all.insert(lineKnowledge(line->name));
    if (!card.entity.members.empty()) all.insert(lineKnowledge("MEMBER"));
    return all;
}

CXMergeResult mergedCard(const UniqueId& uid, const std::optional<Dictionary>& had, const Dictionary& now,
                         const ClientCard& card, const Knows& knows) {
    Dictionary written = aligned(stored(card.entity.properties), now);
    std::optional<Dictionary> base;
    if (had) {
        base = aligned(stored(shownAs(uid, *had, card.isVersion4)), now);
        written = completed(written, *base, knows);
    }
    CXMergeResult merge = mergedContact(base, now, written, CXSide::theirs);
    if (const Value& place = now[kCXRemoteLocationProperty]) merge.contact.set(kCXRemoteLocationProperty, place);
    return merge;
}

bool saysTheSame(const UniqueId& uid, const Dictionary& properties, const ClientCard& card) {
    if (!card.isWhole) return false;
    const Dictionary shown = stored(shownAs(uid, properties, card.isVersion4)), said = stored(card.entity.properties);
    for (const auto& [name, value] : shown)
        if (!isSame(value, said[name])) return false;
    return std::all_of(said.begin(), said.end(), [&](const auto& entry) { return shown.contains(entry.first); });
}

} // namespace rolvane::cardbook
