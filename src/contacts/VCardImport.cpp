#include "contacts/VCardImport.h"

#include "contacts/CXMerger.h"
#include "contacts/VCardFields.h"
#include "contacts/VCardText.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>

namespace rolvane {

namespace {

constexpr uint64_t kProgressBytes = 64 << 10;
constexpr uint64_t kSaveBytes = 64 << 20;

} // namespace

VCardImport::VCardImport(CXRolvane& rolvane, ProgressHandler onProgress, VCardLimits limits)
    : _rolvane(rolvane), _onProgress(std::move(onProgress)), _limits(limits) {}

VCardImportReport VCardImport::importFile(CXRolvane& rolvane, const std::string& path, ProgressHandler onProgress) {
    VCardImport import(rolvane, std::move(onProgress));
    import.addFile(path);
    return import.finish();
}

void VCardImport::addFile(const std::string& path) {
    std::error_code error;
    if (std::filesystem::is_directory(path, error))
        throw CXException(kCXVCardException, path + " is a directory, not a vCard file");
    std::ifstream in(path, std::ios::binary);
    if (!in) throw CXException(kCXVCardException, path + " cannot be read: " + std::strerror(errno));
    auto size = std::filesystem::file_size(path, error);
    addStream(in, path, error ? 0 : size);
}

void VCardImport::addStream(std::istream& in, const std::string& name, uint64_t totalBytes) {
    VCardScanner scanner(
        in, name, [this](const VCardError& e) { report(e); }, _limits);
    VCardProgress progress{0, totalBytes, 0};
    uint64_t told = 0, saved = 0;
    while (auto card = scanner.next()) {
        VCardError error;
        auto entity = vcardEntityFromCard(*card, error);
        if (!entity) {
            scanner.reject(error.line, error.reason);
            continue;
        }
        progress.cards++;
        if (entity->isGroup)
            takeGroup(std::move(*entity), name);
        else
            takePerson(std::move(*entity));
        progress.bytesDone = scanner.bytesRead();
        if (_onProgress && progress.bytesDone - told >= kProgressBytes) {
            told = progress.bytesDone;
            _onProgress(progress);
        }
        if (_unsavedBytes + progress.bytesDone - saved < kSaveBytes) continue;
        _rolvane.save();
        saved = progress.bytesDone;
        _unsavedBytes = 0;
    }
    progress.bytesDone = scanner.bytesRead();
    _unsavedBytes += progress.bytesDone - saved;
    if (_onProgress) _onProgress(progress);
}

void VCardImport::report(const VCardError& error) {
    if (_report.errorCount++ < kVCardErrorsKept) _report.errors.push_back(error);
}

void VCardImport::takePerson(VCardEntity&& card) {
    CXPersonRef person = card.uid.empty() ? nullptr : personForUID(card.uid);
    if (person) {
        auto imported = CXPerson::personFromDictionary(card.properties, nullptr, true, false);
        Dictionary before = person->dictionaryRepresentation();
        CXMerger().updateCard(*person, *imported);
        bool changed = !(person->dictionaryRepresentation() == before);
        (changed ? _report.updated : _report.unchanged)++;
    } else {
        UniqueId uid = card.uid.empty() ? makeUniqueId(kCXPersonTable)
                                        : UniqueId(vcardUUIDForUID(card.uid) + ":" + std::string(kCXPersonTable));
        person = CXPerson::initWithUniqueId(uid);
        person->resetWithDictionary(card.properties, true, false);
        _rolvane.addRecord(person);
        _report.imported++;
    }
    if (!card.categories.empty()) _categories.emplace_back(person->uniqueId(), std::move(card.categories));
}

void VCardImport::takeGroup(VCardEntity&& card, const std::string& file) {
    CXGroupRef group = card.uid.empty() ? nullptr : groupForUID(card.uid);
    if (group) {
        Dictionary merged = CXMerger::merged(group->dictionaryRepresentation(), card.properties);
        for (const auto& [key, value] : merged)
            if (group->valueForProperty(key) != value) group->setValue(value, key);
    } else {
        UniqueId uid = card.uid.empty() ? makeUniqueId(kCXGroupTable)
                                        : UniqueId(vcardUUIDForUID(card.uid) + ":" + std::string(kCXGroupTable));
        group = CXGroup::initWithUniqueId(uid);
        group->resetWithDictionary(card.properties, true, false);
        _rolvane.addRecord(group);
    }
    _report.groups++;
    _groups.push_back({group, std::move(card), file});
}

CXRecordRef VCardImport::recordForUID(const std::string& uid, std::string_view table) const {
    std::string uuid = vcardUUIDForUID(uid);
    // References to a UUID may be spelt in the other letter case than the record.
    for (const std::string& spelling : {uuid, vcardUpper(uuid), vcardLower(uuid)})
        if (auto record = _rolvane.recordForUniqueId(UniqueId(spelling + ":" + std::string(table)))) return record;
    return nullptr;
}

CXPersonRef VCardImport::personForUID(const std::string& uid) const {
    return std::dynamic_pointer_cast<CXPerson>(recordForUID(uid, kCXPersonTable));
}

CXGroupRef VCardImport::groupForUID(const std::string& uid) const {
    return std::dynamic_pointer_cast<CXGroup>(recordForUID(uid, kCXGroupTable));
}

VCardImportReport VCardImport::finish() {
    for (const auto& group : _groups) joinMembers(group);
    for (const auto& group : _groups) choose(group);
    joinCategories();
    _rolvane.save();
    return std::move(_report);
}

void VCardImport::joinMembers(const Group& group) {
    for (const auto& uid : group.card.members) {
        if (auto person = personForUID(uid))
            group.record->addMember(person);
        else if (auto subgroup = groupForUID(uid))
            joinSubgroup(group, uid, subgroup);
        else
            _report.missingMembers++;
    }
    for (const auto& uid : group.card.subgroups) {
        if (auto subgroup = groupForUID(uid))
            joinSubgroup(group, uid, subgroup);
        else
            _report.missingMembers++;
    }
}

void VCardImport::joinSubgroup(const Group& group, const std::string& uid, const CXGroupRef& subgroup) {
    try {
        group.record->addSubgroup(subgroup);
    } catch (const CXException& e) {
        report({group.file, group.card.line, "the subgroup " + uid + " was left out: " + e.reason()});
    }
}

void VCardImport::choose(const Group& group) {
    for (const auto& choice : group.card.choices) {
        CXPersonRef person = personForUID(choice.member);
        auto multi = person ? person->multiValueForProperty(choice.property) : std::nullopt;
        if (!multi) continue;
        for (const auto& entry : multi->entries()) {
            if (entry.label != choice.label || vcardEncodeMultiValue(choice.property, entry.value) != choice.raw)
                continue;
            group.record->setDistributionIdentifier(entry.identifier, choice.property, person);
            break;
        }
    }
}

void VCardImport::joinCategories() {
    if (_categories.empty()) return;
    for (const auto& listing : _rolvane.listGroups(RemoteLocation("")))
        if (auto group = std::dynamic_pointer_cast<CXGroup>(_rolvane.recordForUniqueId(listing.uniqueId)))
            _groupsByName[group->name()].push_back(group);
    for (const auto& [uid, names] : _categories) {
        auto person = std::dynamic_pointer_cast<CXPerson>(_rolvane.recordForUniqueId(uid));
        for (const auto& name : names)
            if (person) joinCategory(person, name);
    }
}

// The person belongs to one group of the name at least; which one is left alone when there are several.
void VCardImport::joinCategory(const CXPersonRef& person, const std::string& name) {
    auto& groups = _groupsByName[name];
    if (groups.empty()) {
        CXGroupRef group = CXGroup::create();
        group->setValue(name, kCXGroupNameProperty);
        _rolvane.addRecord(group);
        groups.push_back(group);
        _report.groups++;
    }
    if (groups.size() > 1) {
        auto parents = person->parentGroupUniqueIds();
        for (const auto& group : groups)
            if (std::find(parents.begin(), parents.end(), group->uniqueId()) != parents.end()) return;
    }
    groups.front()->addMember(person);
}

} // namespace rolvane
