#include "engine/queue/ChangeQueue.h"

#include "contacts/records/Identifier.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"

#include <algorithm>
#include <cstdint>
#include <functional>
#include <iterator>
#include <map>
#include <optional>
#include <unordered_map>
#include <vector>

namespace rolvane {

namespace {

bool isGroupChange(const CXDChangeRecord& record) {
    return record.group() && *record.group() != kPeopleGroup;
}

bool merges(CXDChangeRecord& record) {
    try {
        return record.canBeMerged();
    } catch (const CXException& e) {
        CXLog("Exception with reading change record: %@", e);
        CXLog("Change record: %@", record);
        return false;
    }
}

// A record of the work list: itself, or its part for one source, which is made when it is needed. A record's part
// differs from it in the mask alone, unless the record has a delayed payload.
class Part {
public:
    explicit Part(CXDChangeRecordPtr record) : _record(std::move(record)), _isWhole(true) {}
    Part(CXDChangeRecordPtr record, int32_t sources) : _record(std::move(record)), _sources(sources) {}

    bool isFolded() const { return !_record; }
    void fold() { _record = nullptr; }
    CXDChangeRecord& content() { return *_record; } // but for the mask
    int32_t sources() const { return _isWhole ? _record->appliesToSources() : _sources; }
    CXDChangeRecordPtr take() {
        CXDChangeRecordPtr taken = std::move(_record);
        if (_isWhole) return taken;
        taken = taken->copy();
        taken->setAppliesToSources(_sources);
        return taken;
    }

private:
    CXDChangeRecordPtr _record;
    int32_t _sources = 0;
    bool _isWhole = false;
};

bool startsFold(Part& part) {
    CXDChangeRecord& record = part.content();
    if (part.sources() == CXDSyncSourceCX || !isGroupChange(record)) return false;
    switch (record.type()) {
    case CXDCompositeGroupChange:
    case CXDChangeGroupReadACL:
    case CXDChangeGroupReadWriteACL:
    case CXDDeleteRecord:
    case CXDDeleteGroup: return false;
    default: return merges(record);
    }
}

// Whose group: every user has an all-contacts group, and all are called the same.
struct GroupOfUser {
    explicit GroupOfUser(const CXDChangeRecord& record) : group(*record.group()), user(record.user()) {}
    bool operator==(const GroupOfUser&) const = default;

    UniqueId group;
    std::optional<UserName> user;
};

struct GroupOfUserHash {
    size_t operator()(const GroupOfUser& of) const {
        return std::hash<UniqueId>{}(of.group) * 31 + (of.user ? std::hash<UserName>{}(*of.user) : 0);
    }
};

// A composite that takes such a record in says nothing of it.
void noteIfLost(const CXDChangeRecord& record, const UniqueId& group, LostInFolds& lost) {
    if (record.initialSource() != CXDSyncSourceCX) return;
    switch (record.type()) {
    case CXDChangeGroupReadACL:
    case CXDChangeGroupReadWriteACL: lost.lists.insert(group); break;
    case CXDCompositeGroupChange:
    case CXDDeleteGroup: lost.contents.insert(group); break;
    default: break;
    }
}

std::vector<Part> split(const CXDChangeRecords& records) {
    std::vector<Part> work;
    work.reserve(records.size());
    for (const CXDChangeRecordPtr& record : records) {
        if (!isGroupChange(*record)) {
            work.emplace_back(record);
            continue;
        }
        if (record->hasDelayedPayload()) {
            for (CXDChangeRecordPtr& part : record->splitChangeRecord()) work.emplace_back(std::move(part));
            continue;
        }
        for (const int32_t source : CXDChangeRecord::kSplitOrder)
            if (record->appliesToSources() & source) work.emplace_back(record, source);
    }
    return work;
}

CXDChangeRecordPtr compositeFor(Part& part) {
    const CXDChangeRecord& record = part.content();
    auto composite = std::make_shared<CXDChangeRecord>(record.initialSource(), CXDCompositeGroupChange, record.user(),
                                                       std::nullopt, record.group());
    composite->setAppliesToSources(part.sources());
    return composite;
}

} // namespace

void putNewsOfGroupsLast(CXDChangeRecords& records) {
    std::stable_partition(records.begin(), records.end(), [](const CXDChangeRecordPtr& record) {
        return !record->group() || record->initialSource() == CXDSyncSourceCX ||
               record->appliesToSources() != CXDSyncSourceCX;
    });
}

CXDChangeRecords flattenGroupChanges(const CXDChangeRecords& records, LostInFolds* lost) {
    std::vector<Part> work = split(records);
    std::unordered_map<GroupOfUser, std::vector<uint32_t>, GroupOfUserHash> placesOfGroup; // ascending
    for (size_t i = 0; i < work.size(); ++i)
        if (isGroupChange(work[i].content()))
            placesOfGroup[GroupOfUser(work[i].content())].push_back(static_cast<uint32_t>(i));

    CXDChangeRecords flat; // from the back to the front
    for (size_t i = work.size(); i-- > 0;) {
        if (work[i].isFolded()) continue;
        if (!startsFold(work[i])) {
            flat.push_back(work[i].take());
            continue;
        }
        const CXDChangeRecordPtr composite = compositeFor(work[i]);
        composite->mergeWithGroupChangeRecord(work[i].content());
        std::vector<uint32_t>& places = placesOfGroup[GroupOfUser(*composite)];
        work[i].fold();
        std::vector<uint32_t> kept;
        for (; !places.empty(); places.pop_back()) {
            Part& earlier = work[places.back()];
            if (earlier.isFolded()) continue;
            if (!merges(earlier.content())) {
                kept.push_back(places.back());
                continue;
            }
            if (lost) noteIfLost(earlier.content(), *composite->group(), *lost);
            composite->mergeWithGroupChangeRecord(earlier.content());
            earlier.fold();
        }
        places.assign(kept.rbegin(), kept.rend());
        flat.push_back(composite);
    }
    std::reverse(flat.begin(), flat.end());
    return flat;
}

void sortByType(CXDChangeRecords& records) {
    std::map<uint32_t, CXDChangeRecords> byType; // the order of compare
    for (CXDChangeRecordPtr& record : records)
        byType[static_cast<uint32_t>(record->type())].push_back(std::move(record));
    records.clear();
    for (auto& [type, all] : byType) std::move(all.begin(), all.end(), std::back_inserter(records));
}

bool isListOfEverybody(const CXDChangeRecord& record) {
    return record.type() == CXDCompositeGroupChange && record.group() &&
           cxUIDWithTableName(*record.group(), kCXGroupTable).str() == kCXAllGroupUID;
}

void putListsOfEverybodyFirst(CXDChangeRecords& sorted) {
    const auto isComposite = [](const CXDChangeRecordPtr& record) { return record->type() == CXDCompositeGroupChange; };
    const auto first = std::find_if(sorted.begin(), sorted.end(), isComposite);
    std::stable_partition(first, std::find_if_not(first, sorted.end(), isComposite),
                          [](const CXDChangeRecordPtr& record) { return isListOfEverybody(*record); });
}

} // namespace rolvane
