#include "contacts/vcard/VCardImport.h"

#include "contacts/records/CXMerger.h"
#include "contacts/records/CXMultiValue.h"
#include "contacts/vcard/TextCharset.h"
#include "contacts/vcard/VCardFields.h"
#include "contacts/vcard/VCardLabels.h"
#include "contacts/vcard/VCardText.h"
#include "foundation/PropertyList.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <utility>

namespace rolvane {

namespace {

constexpr uint64_t kProgressBytes = 64 << 10;
constexpr uint64_t kSaveBytes = 64 << 20;
constexpr size_t kMostTableBytes = 256 << 20;

// Earlier versions took the labels of telephones for labels of their own, and imported them as they stood.
Dictionary withCommonLabels(const Dictionary& own) {
    Dictionary properties = Value(own).deepMutableCopy().dictionary();
    for (const char* property : {kCXPhoneProperty, kCXEmailProperty, kCXAddressProperty, kCXURLsProperty,
                                 kCXInstantMessageProperty, kCXRelatedNamesProperty, kCXOtherDatesProperty}) {
        const auto multi = CXMultiValue::fromValue(properties[property]);
        if (!multi) continue;
        CXMutableMultiValue common;
        bool changed = false;
        for (const auto& entry : multi->entries()) {
            const std::string label = vcardLabelFromText(entry.label);
            changed = changed || label != entry.label;
            common.addValue(entry.value, label, entry.identifier);
        }
        if (changed) properties.set(property, common.toValue());
    }
    return properties;
}

} // namespace

VCardImport::VCardImport(CXRolvane& rolvane, ProgressHandler onProgress, VCardLimits limits)
    : _rolvane(rolvane), _onProgress(std::move(onProgress)), _limits(limits), _owners(rolvane) {}

VCardImportReport VCardImport::importFile(CXRolvane& rolvane, const std::string& path, ProgressHandler onProgress) {
    VCardImport import(rolvane, std::move(onProgress));
    import.addFile(path);
    return import.finish();
}

void VCardImport::addFile(const std::string& path) {
    ImportSource source = ImportSource::ofFile(path);
    addCards(source);
}

void VCardImport::addStream(std::istream& in, const std::string& name, uint64_t totalBytes) {
    ImportSource source = ImportSource::ofStream(in, name, totalBytes);
    addCards(source);
}

void VCardImport::addCards(ImportSource& source) {
    if (source.wasUTF16()) _report.foreign.push_back({source.name(), "UTF-16", false, 0});
    const TableKind kind = tableKindOf(source.start());
    if (kind != TableKind::none) return addTable(source, kind);
    VCardScanner scanner(
        source.text(), source.name(), [this](const VCardError& e) { report(e); }, _limits);
    const std::string foreign = foreignTextOfCards(source.text());
    std::string charset = _charset;
    if (charset.empty() && !foreign.empty()) charset = detectedCharset(foreign);
    scanner.setFallbackCharset(charset);
    VCardProgress progress{0, source.bytes(), 0};
    uint64_t told = 0, saved = 0;
    while (auto card = scanner.next()) {
        VCardError error;
        auto entity = vcardEntityFromCard(*card, error);
        if (!entity) {
            scanner.reject(error.line, error.reason);
            continue;
        }
        progress.cards++;
        take(std::move(*entity), source.name());
        progress.bytesDone = scanner.bytesRead();
        if (_onProgress && progress.bytesDone - told >= kProgressBytes) {
            told = progress.bytesDone;
            _onProgress(progress);
        }
        if (_dryRun || _unsavedBytes + progress.bytesDone - saved < kSaveBytes) continue;
        _rolvane.save();
        saved = progress.bytesDone;
        _unsavedBytes = 0;
    }
    if (scanner.fallbackLines() > 0)
        _report.foreign.push_back({source.name(), charset, _charset.empty(), scanner.fallbackLines()});
    progress.bytesDone = scanner.bytesRead();
    _unsavedBytes += progress.bytesDone - saved;
    if (_onProgress) _onProgress(progress);
}

std::string VCardImport::textOfTable(ImportSource& source) {
    std::string text = source.whole(kMostTableBytes);
    if (!vcardFirstInvalidUTF8(text)) return text;
    const std::string charset = _charset.empty() ? detectedCharset(text) : _charset;
    auto converted = vcardConvertToUTF8(text, charset);
    if (!converted)
        throw CXException(kCXVCardException, source.name() + " is neither UTF-8 nor " + charset +
                                                 ". Name its character set with --charset");
    _report.foreign.push_back({source.name(), charset, _charset.empty(), 0});
    return std::move(*converted);
}

void VCardImport::addTable(ImportSource& source, TableKind kind) {
    const std::string text = textOfTable(source);
    TableCards table = kind == TableKind::ldif ? cardsOfLdif(text) : cardsOfTable(text);
    for (const auto& n : table.notices) {
        if (n.lost) _report.linesLost++;
        notice(source.name(), n.line, n.reason + (n.lost ? "; it was left out" : ""));
    }
    if (!table.intoTheNote.empty()) _report.intoTheNote.push_back({source.name(), table.intoTheNote});
    _entries.clear();
    VCardProgress progress{0, source.bytes(), 0};
    for (auto& card : table.cards) {
        progress.cards++;
        const std::string entry = table.namesItself ? std::exchange(card.uid, "") : "";
        if (card.isGroup) {
            takeGroup(std::move(card), source.name());
            if (!entry.empty()) _entries[entry] = _groups.back().record->uniqueId();
        } else {
            takePerson(std::move(card), source.name());
            if (!entry.empty()) _entries[entry] = _lastPerson;
        }
    }
    progress.bytesDone = source.bytes();
    if (_onProgress) _onProgress(progress);
}

void VCardImport::report(const VCardError& error) {
    if (_report.errorCount++ < kVCardErrorsKept) _report.errors.push_back(error);
}

void VCardImport::notice(const std::string& file, size_t line, const std::string& reason) {
    if (_report.noticeCount++ < kVCardErrorsKept) _report.notices.push_back({file, line, reason});
}

void VCardImport::reportNotices(const VCardEntity& card, const std::string& file) {
    const std::string name =
        card.isGroup ? card.properties[kCXGroupNameProperty].string() : cxDisplayName(card.properties);
    for (const auto& n : card.notices) {
        if (n.lost) _report.linesLost++;
        notice(file, n.line,
               n.reason +
                   (n.lost ? "; it was left out of the card of " : "; the line is kept as it stands in the card of ") +
                   name);
    }
}

void VCardImport::take(VCardEntity&& card, const std::string& file) {
    reportNotices(card, file);
    if (card.isGroup)
        takeGroup(std::move(card), file);
    else
        takePerson(std::move(card), file);
}

// Who has the card's UID, or whom a card without one is surely about; null for somebody new.
CXPersonRef VCardImport::ownerOf(const VCardEntity& card, const std::string& file) {
    if (!card.uid.empty()) return personForUID(card.uid);
    const auto found = _owners.find(card.properties, _touched);
    if (!found.person && found.another) {
        _report.doubtful++;
        notice(file, card.line,
               "somebody called " + cxDisplayName(card.properties) +
                   " is here already with other addresses and numbers; the card was added beside");
    }
    return found.person;
}

void VCardImport::update(const CXPersonRef& person, const VCardEntity& card) {
    Dictionary before = person->dictionaryRepresentation();
    Dictionary merged = CXMerger::merged(withCommonLabels(before), card.properties);
    // A card has one order of its categories, which keepCategoryOrder sees to.
    vcardReplaceKeptLines(merged, kVCardCategoryOrderLine, vcardKeptLines(before, kVCardCategoryOrderLine));
    bool changed = false;
    for (const auto& [key, value] : merged) {
        if (before[key] == value) continue;
        person->setValue(value, key);
        changed = true;
    }
    (changed ? _report.updated : _report.unchanged)++;
}

void VCardImport::takePerson(VCardEntity&& card, const std::string& file) {
    CXPersonRef person = ownerOf(card, file);
    if (person) {
        const auto imported = CXPerson::personFromDictionary(card.properties, nullptr, true, false);
        card.properties = imported->dictionaryRepresentation();
        update(person, card);
    } else {
        UniqueId uid = card.uid.empty() ? makeUniqueId(kCXPersonTable)
                                        : UniqueId(vcardUUIDForUID(card.uid) + ":" + std::string(kCXPersonTable));
        person = CXPerson::initWithUniqueId(uid);
        person->resetWithDictionary(card.properties, true, false);
        _rolvane.addRecord(person);
        _report.imported++;
    }
    _owners.note(*person);
    _touched.insert(person->uniqueId());
    _lastPerson = person->uniqueId();
    if (!card.categories.empty()) _categories.emplace_back(person->uniqueId(), std::move(card.categories));
}

// A group without UID is the one of its name.
CXGroupRef VCardImport::groupOf(const VCardEntity& card) const {
    if (!card.uid.empty()) return groupForUID(card.uid);
    const std::string name = card.properties[kCXGroupNameProperty].string();
    CXGroupRef found;
    for (const auto& listing : _rolvane.listGroups(RemoteLocation(""))) {
        if (listing.displayName != name) continue;
        if (found) return nullptr; // which of them cannot be told
        found = std::dynamic_pointer_cast<CXGroup>(_rolvane.recordForUniqueId(listing.uniqueId));
    }
    return found;
}

void VCardImport::takeGroup(VCardEntity&& card, const std::string& file) {
    CXGroupRef group = groupOf(card);
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
    const auto named = [&](const std::string& spelling) {
        return _rolvane.recordForUniqueId(UniqueId(spelling + ":" + std::string(table)));
    };
    if (auto record = named(uuid)) return record;
    // References to a UUID may be spelt in the other letter case than the record. Each look-up costs two statements.
    for (const std::string& other : {vcardUpper(uuid), vcardLower(uuid)})
        if (other != uuid)
            if (auto record = named(other)) return record;
    return nullptr;
}

// UIDs of cards whose people were joined with others, read once: who has one keeps it in a line.
const std::map<std::string, UniqueId>& VCardImport::mergedUIDs() const {
    if (_mergedUIDs) return *_mergedUIDs;
    _mergedUIDs.emplace();
    if (_rolvane.countPeople(RemoteLocation("")) == 0) return *_mergedUIDs;
    const std::string_view mark(kVCardJoinedUIDLine);
    _rolvane.forEachPersonModifiedSince(Date::distantPast(), kCXPersonTable, [&](const CXRow& row) {
        const std::string_view bytes(reinterpret_cast<const char*>(row.encoded->data()), row.encoded->size());
        if (bytes.find(mark) == std::string_view::npos) return;
        for (const auto& line : vcardKeptLines(BinaryValue::decode(*row.encoded).dictionary(), mark))
            (*_mergedUIDs)[vcardMemberKey(vcardUnescape(line.value))] = row.uniqueId;
    });
    return *_mergedUIDs;
}

CXPersonRef VCardImport::personForUID(const std::string& uid) const {
    if (const auto entry = _entries.find(uid); entry != _entries.end())
        return std::dynamic_pointer_cast<CXPerson>(_rolvane.recordForUniqueId(entry->second));
    if (auto person = std::dynamic_pointer_cast<CXPerson>(recordForUID(uid, kCXPersonTable))) return person;
    const auto joined = mergedUIDs().find(vcardMemberKey(uid));
    if (joined == mergedUIDs().end()) return nullptr;
    return std::dynamic_pointer_cast<CXPerson>(_rolvane.recordForUniqueId(joined->second));
}

CXGroupRef VCardImport::groupForUID(const std::string& uid) const {
    if (const auto entry = _entries.find(uid); entry != _entries.end())
        return std::dynamic_pointer_cast<CXGroup>(_rolvane.recordForUniqueId(entry->second));
    return std::dynamic_pointer_cast<CXGroup>(recordForUID(uid, kCXGroupTable));
}

VCardImportReport VCardImport::finish() {
    for (const auto& group : _groups) joinMembers(group);
    settleMissingMembers();
    for (const auto& group : _groups) choose(group);
    joinCategories();
    keepCategoryOrder();
    if (_dryRun)
        _rolvane.rollback();
    else
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
            _missing[group.record->uniqueId()].push_back(uid);
    }
    for (const auto& uid : group.card.subgroups) {
        if (auto subgroup = groupForUID(uid))
            joinSubgroup(group, uid, subgroup);
        else
            _missing[group.record->uniqueId()].push_back(uid);
    }
}

// Members without a card are kept by their UIDs. Those whose cards have come join their groups, whenever that is.
void VCardImport::settleMissingMembers() {
    for (const auto& listing : _rolvane.listGroups(RemoteLocation(""))) {
        const auto group = std::dynamic_pointer_cast<CXGroup>(_rolvane.recordForUniqueId(listing.uniqueId));
        if (!group || group->isAllGroup()) continue;
        Dictionary properties = group->dictionaryRepresentation();
        std::vector<std::string> uids;
        for (const auto& line : vcardKeptLines(properties, kVCardMissingMemberLine))
            uids.push_back(vcardUnescape(line.value));
        const auto fresh = _missing.find(group->uniqueId());
        if (fresh != _missing.end()) {
            _report.missingMembers += fresh->second.size();
            for (const auto& uid : fresh->second)
                if (std::find(uids.begin(), uids.end(), uid) == uids.end()) uids.push_back(uid);
        }
        std::vector<VCardLine> missing;
        for (const auto& uid : uids) {
            if (const auto person = personForUID(uid)) {
                group->addMember(person);
                continue;
            }
            if (const auto subgroup = groupForUID(uid)) {
                if (group->mayListSubgroup(subgroup)) group->addSubgroup(subgroup);
                continue;
            }
            VCardLine line;
            line.name = kVCardMissingMemberLine;
            line.value = vcardEscape(uid);
            missing.push_back(std::move(line));
        }
        vcardReplaceKeptLines(properties, kVCardMissingMemberLine, missing);
        const Value& extras = properties[kCXVCardExtraProperty];
        if (group->valueForProperty(kCXVCardExtraProperty) != extras) group->setValue(extras, kCXVCardExtraProperty);
    }
}

// Categories are groups, which have no order of their own: the export writes them by name. Any other order is kept.
void VCardImport::keepCategoryOrder() {
    for (const auto& [uid, names] : _categories) {
        const auto person = std::dynamic_pointer_cast<CXPerson>(_rolvane.recordForUniqueId(uid));
        if (!person) continue;
        const Value before = person->valueForProperty(kCXVCardExtraProperty);
        std::vector<VCardLine> order;
        if (std::is_sorted(names.begin(), names.end())) {
            if (!before) continue; // nothing is kept, and nothing needs to be
        } else {
            VCardLine line;
            line.name = kVCardCategoryOrderLine;
            line.value = vcardEncodeList(names);
            order.push_back(std::move(line));
        }
        Dictionary properties;
        if (before) properties.set(kCXVCardExtraProperty, before.deepMutableCopy());
        vcardReplaceKeptLines(properties, kVCardCategoryOrderLine, order);
        const Value& extras = properties[kCXVCardExtraProperty];
        if (before != extras) person->setValue(extras, kCXVCardExtraProperty);
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
