#include "contacts/vcard/VCardExport.h"

#include "contacts/vcard/VCardFields.h"
#include "foundation/PropertyList.h"

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace rolvane {

namespace {

// The UID text that the record's card came with, "" when its identifier says it all.
std::string keptUID(const Dictionary& properties) {
    const Array* extras = properties[kCXVCardExtraProperty].arrayIf();
    for (size_t i = 0; extras && i < extras->count(); i++) {
        const std::string& text = (*extras)[i].string();
        if (!text.starts_with("UID")) continue;
        auto line = vcardParseLine(text);
        if (line && line->name == "UID") return vcardUnescape(line->value);
    }
    return "";
}

// Categories by name, but in the order of the card that the person came with.
void putInOrder(VCardEntity& card) {
    auto& names = card.categories;
    std::sort(names.begin(), names.end());
    const auto lines = vcardKeptLines(card.properties, kVCardCategoryOrderLine);
    if (lines.empty()) return;
    const auto order = vcardDecodeList(lines.front());
    std::stable_sort(names.begin(), names.end(), [&](const std::string& a, const std::string& b) {
        return std::find(order.begin(), order.end(), a) < std::find(order.begin(), order.end(), b);
    });
    vcardReplaceKeptLines(card.properties, kVCardCategoryOrderLine, {});
}

std::string trimmedUID(std::string uid) {
    while (!uid.empty() && (uid.back() == ' ' || uid.back() == '\t')) uid.pop_back();
    return uid;
}

} // namespace

VCardExport::VCardExport(CXRolvane& rolvane, std::ostream& out, VCardVersion version, ProgressHandler onProgress)
    : _rolvane(rolvane), _out(out), _version(version), _onProgress(std::move(onProgress)) {
    studyGroups();
}

void VCardExport::studyGroups() {
    for (const auto& listing : _rolvane.listGroups(std::nullopt)) _groupNames[listing.uniqueId] = listing.displayName;
}

size_t VCardExport::exportAll() {
    _total = _rolvane.countPeople(RemoteLocation(""));
    _rolvane.forEachPersonModifiedSince(Date::distantPast(), kCXPersonTable, [&](const CXRow& row) {
        writePerson(row.uniqueId, BinaryValue::decode(*row.encoded).dictionary(), row.parentGroups);
    });
    for (const auto& listing : _rolvane.listGroups(RemoteLocation("")))
        if (auto group = std::dynamic_pointer_cast<CXGroup>(_rolvane.recordForUniqueId(listing.uniqueId)))
            writeGroup(group);
    finish();
    return _cards;
}

size_t VCardExport::exportGroup(const CXGroupRef& group) {
    if (group->isAllGroup() && !group->isSubscribed()) return exportAll();
    return exportRecords({group->uniqueId()});
}

size_t VCardExport::exportRecords(const std::vector<UniqueId>& uids) {
    _total = uids.size();
    for (const auto& uid : uids) {
        auto record = _rolvane.recordForUniqueId(uid);
        if (auto person = std::dynamic_pointer_cast<CXPerson>(record))
            writePerson(person);
        else if (auto group = std::dynamic_pointer_cast<CXGroup>(record))
            writeMembersOf(group);
    }
    for (const auto& group : _groupsToWrite) writeGroup(group);
    finish();
    return _cards;
}

void VCardExport::writePerson(const CXPersonRef& person) {
    writePerson(person->uniqueId(), person->dictionaryRepresentation(), person->parentGroupUniqueIds());
}

void VCardExport::writePerson(const UniqueId& uid, const Dictionary& properties, const std::vector<UniqueId>& parents) {
    if (!_written.insert(uid).second) return;
    VCardEntity card;
    card.properties = properties;
    std::string kept = trimmedUID(keptUID(properties));
    if (!kept.empty()) _keptUIDs[uid] = kept;
    card.uid = vcardUIDForUUID(cxUUIDPart(uid));
    for (const auto& parent : parents) {
        auto name = _groupNames.find(parent);
        if (name != _groupNames.end()) card.categories.push_back(name->second);
    }
    putInOrder(card);
    write(card);
    if (_onProgress) _onProgress(_written.size(), std::max(_total, _written.size()));
}

void VCardExport::writeMembersOf(const CXGroupRef& group) {
    if (!_written.insert(group->uniqueId()).second) return;
    _groupsToWrite.push_back(group);
    _total += group->memberCount();
    for (const auto& member : group->members()) writePerson(member);
    for (const auto& subgroup : group->subgroups()) writeMembersOf(subgroup);
}

std::string VCardExport::uidTextOf(const UniqueId& uid) const {
    auto kept = _keptUIDs.find(uid);
    return kept != _keptUIDs.end() ? kept->second : vcardUIDForUUID(cxUUIDPart(uid));
}

void VCardExport::writeGroup(const CXGroupRef& group) {
    VCardEntity card;
    card.isGroup = true;
    card.uid =
        vcardUIDForUUID(group->isAllGroup() ? vcardUUIDForUID(group->uniqueId().str()) : cxUUIDPart(group->uniqueId()));
    card.properties = group->dictionaryRepresentation();
    for (const auto& uid : group->memberUniqueIds()) card.members.push_back(uidTextOf(uid));
    for (const auto& subgroup : group->subgroups()) {
        std::string kept = trimmedUID(keptUID(subgroup->dictionaryRepresentation()));
        card.subgroups.push_back(kept.empty() ? vcardUIDForUUID(cxUUIDPart(subgroup->uniqueId())) : kept);
    }
    // Members whose cards never came are named like the others.
    for (const auto& line : vcardKeptLines(card.properties, kVCardMissingMemberLine))
        card.members.push_back(vcardUnescape(line.value));
    vcardReplaceKeptLines(card.properties, kVCardMissingMemberLine, {});
    addChoices(card, group);
    write(card);
}

void VCardExport::addChoices(VCardEntity& card, const CXGroupRef& group) {
    for (const auto& [uid, choices] : group->distributionChoices()) {
        auto person = std::dynamic_pointer_cast<CXPerson>(_rolvane.recordForUniqueId(uid));
        for (const auto& [property, identifier] : choices) {
            auto multi = person ? person->multiValueForProperty(property) : std::nullopt;
            auto label = multi ? multi->labelForIdentifier(identifier) : std::nullopt;
            auto raw = label ? vcardEncodeMultiValue(property, multi->valueForIdentifier(identifier)) : std::nullopt;
            if (raw) card.choices.push_back({uidTextOf(uid), property, *label, *raw});
        }
    }
}

void VCardExport::write(const VCardEntity& card) {
    _out << vcardText(card, _version);
    check();
    _cards++;
}

// A stream holds text back; only what it has handed on is written.
void VCardExport::finish() {
    _out.flush();
    check();
}

void VCardExport::check() {
    if (!_out)
        throw CXException(kCXVCardException,
                          std::string("the vCards cannot be written: ") + std::strerror(errno ? errno : EIO));
}

} // namespace rolvane
