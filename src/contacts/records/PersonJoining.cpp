#include "contacts/records/PersonJoining.h"

#include "contacts/records/CXMerger.h"
#include "contacts/records/CXMultiValue.h"
#include "contacts/vcard/VCardFields.h"
#include "contacts/vcard/VCardKept.h"
#include "contacts/vcard/VCardReader.h"
#include "contacts/vcard/VCardText.h"
#include "foundation/PropertyList.h"

#include <algorithm>
#include <map>

namespace rolvane {

namespace {

struct Candidate {
    UniqueId uid;
    std::string name;
    std::set<std::string> reached;
};

std::string textOf(const Value& value) {
    if (value.isDate()) return value.date()->toISO8601().substr(0, 10);
    return value.isString() ? value.string() : value.description();
}

// Groups of the candidates that have a key in common, by the first two of whom they were made of.
template <class KeysOf>
std::vector<std::vector<size_t>> together(const std::vector<Candidate>& all, const KeysOf& keysOf) {
    std::map<std::string, std::vector<size_t>> byKey;
    for (size_t i = 0; i < all.size(); i++)
        for (const std::string& key : keysOf(all[i])) byKey[key].push_back(i);
    std::set<std::vector<size_t>> groups;
    for (auto& [key, group] : byKey)
        if (group.size() > 1) groups.insert(std::move(group));
    return {groups.begin(), groups.end()};
}

VCardLine uidLine(const UniqueId& uid) {
    VCardLine line;
    line.name = kVCardJoinedUIDLine;
    line.value = vcardEscape(vcardUIDForUUID(cxUUIDPart(uid)));
    return line;
}

// The second photo, as a card has further ones.
void keepPhoto(Dictionary& properties, const Dictionary& second) {
    const VCardPhoto photo{second[kCXPhotoProperty].data(), second[kCXPhotoTypeProperty].string()};
    const auto kept = vcardKeptForm(vcardEncodePhoto(photo, false));
    Array extras = properties.arrayFor(kCXVCardExtraProperty);
    if (kept) extras.append(vcardFormatLine(*kept));
}

} // namespace

std::vector<AlikePeople> findAlikePeople(CXRolvane& rolvane) {
    std::vector<Candidate> all;
    std::vector<UniqueId> uids;
    for (const auto& listing : rolvane.listPeople(RemoteLocation(""))) uids.push_back(listing.uniqueId);
    rolvane.forEachOf(uids, [&](const CXRow& row) {
        const Dictionary person = BinaryValue::decode(*row.encoded).dictionary();
        all.push_back({row.uniqueId, cxComparedName(cxDisplayName(person)), cxReachedBy(person)});
    });
    std::vector<AlikePeople> found;
    const auto add = [&](const std::vector<size_t>& group, CXAlikeness alikeness) {
        AlikePeople alike{alikeness, {}};
        for (const size_t i : group) alike.people.push_back(all[i].uid);
        found.push_back(std::move(alike));
    };
    const auto properties = [&](size_t i) {
        return BinaryValue::decode(*rolvane.personRow(all[i].uid)->encoded).dictionary();
    };
    for (const auto& group : together(all, [](const Candidate& c) { return std::vector{c.name}; })) {
        CXAlikeness least = CXAlikeness::same;
        const Dictionary first = properties(group.front());
        for (size_t i = 1; i < group.size(); i++) least = std::min(least, cxAlikeness(first, properties(group[i])));
        add(group, least);
    }
    for (const auto& group : together(all, [](const Candidate& c) { return c.reached; })) {
        const bool oneName =
            std::all_of(group.begin(), group.end(), [&](size_t i) { return all[i].name == all[group.front()].name; });
        if (!oneName) add(group, CXAlikeness::reached);
    }
    std::stable_sort(found.begin(), found.end(),
                     [](const AlikePeople& a, const AlikePeople& b) { return a.alikeness > b.alikeness; });
    return found;
}

JoinedProperties joinedProperties(const Dictionary& first, const Dictionary& second, const UniqueId& secondUid) {
    JoinedProperties joined{CXMerger::merged(first, second), {}};
    Dictionary& result = joined.properties;
    std::string note = first[kCXNoteProperty].string();
    const auto addToNote = [&](const std::string& text) { note += (note.empty() ? "" : "\n") + text; };
    for (const auto& [key, value] : second) {
        const Value& own = first[key];
        if (!own || own == value || CXMultiValue::fromValue(own) || own.isArray()) continue;
        result.set(key, own.deepMutableCopy());
        if (key == kCXPhotoTypeProperty) continue; // goes with the photo
        if (key == kCXPhotoProperty) {
            keepPhoto(result, second);
            joined.gaveWay.push_back("a photo, kept as a second one");
        } else if (key == kCXNoteProperty) {
            addToNote(textOf(value));
        } else {
            joined.gaveWay.push_back(key + ": " + textOf(value));
            addToNote(joined.gaveWay.back());
        }
    }
    if (!note.empty()) result.set(kCXNoteProperty, note);
    // Whoever imports a card of the second one again means the first. A card has one UID, and it keeps its own.
    auto lines = vcardKeptLines(result, kVCardJoinedUIDLine);
    lines.push_back(uidLine(secondUid));
    for (auto& line : vcardKeptLines(second, "UID")) {
        line.name = kVCardJoinedUIDLine;
        line.parameters.clear();
        lines.push_back(std::move(line));
    }
    vcardReplaceKeptLines(result, kVCardJoinedUIDLine, lines);
    vcardReplaceKeptLines(result, "UID", vcardKeptLines(first, "UID"));
    return joined;
}

std::vector<std::string> joinPeople(CXRolvane& rolvane, const CXPersonRef& first, const CXPersonRef& second) {
    const Dictionary before = first->dictionaryRepresentation();
    const Dictionary other = second->dictionaryRepresentation();
    const JoinedProperties joined = joinedProperties(before, other, second->uniqueId());
    for (const auto& [key, value] : joined.properties)
        if (before[key] != value) first->setValue(value, key);
    const auto choices = CXGroup::distributionChoicesForPerson(*second);
    for (const CXGroupRef& group : second->parentGroups()) {
        group->addMember(first);
        const auto chosen = choices.find(group->uniqueId());
        if (chosen == choices.end()) continue;
        for (const auto& [property, identifier] : chosen->second) {
            if (group->distributionIdentifierForProperty(property, first)) continue;
            // The entry may have been the first's already, under its own identifier.
            const auto theirs = CXMultiValue::fromValue(other[property]);
            const auto ours = first->multiValueForProperty(property);
            if (!theirs || !ours) continue;
            for (const auto& entry : ours->entries())
                if (entry.value == theirs->valueForIdentifier(identifier)) {
                    group->setDistributionIdentifier(entry.identifier, property, first);
                    break;
                }
        }
    }
    rolvane.removeRecord(second);
    return joined.gaveWay;
}

} // namespace rolvane
