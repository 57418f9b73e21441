#include "engine/pass/RecordTurns.h"

#include "engine/queue/ChangeQueue.h"
#include "foundation/Mutex.h"

#include <functional>

namespace rolvane {

namespace {

// What a record changes; the record itself lends its texts.
struct Target {
    const CXDChangeRecord* record;
    const std::optional<UniqueId>& thing() const { return record->group() ? record->group() : record->person(); }
    bool operator==(const Target& other) const {
        return thing() == other.thing() && record->user() == other.record->user();
    }
};

struct TargetHash {
    size_t operator()(const Target& target) const {
        return target.thing() ? std::hash<UniqueId>{}(*target.thing()) : 0;
    }
};

bool isContact(const CXDChangeRecord& record) {
    return record.type() == CXDUpdateRecord || record.type() == CXDCreateStructureForGroup;
}

bool comesBehindTheList(const CXDChangeRecord& record) {
    return (record.type() == CXDCompositeGroupChange && !isListOfEverybody(record)) ||
           record.type() == CXDDeleteRecord || record.type() == CXDDeleteGroup;
}

} // namespace

RecordTurns::RecordTurns(const CXDChangeRecords& records, const std::function<bool(const UserName&)>& inOrder) {
    if (inOrder) order(records, inOrder);
    std::unordered_map<Target, const CXDChangeRecord*, TargetHash> latest;
    latest.reserve(records.size());
    for (const CXDChangeRecordPtr& record : records) {
        const auto [place, first] = latest.try_emplace(Target{record.get()}, record.get());
        if (first || place->second == record.get()) continue;
        const std::shared_ptr<std::latch> before = _turns[place->second].own;
        _turns[record.get()].before = before;
        place->second = record.get();
    }
}

void RecordTurns::order(const CXDChangeRecords& records, const std::function<bool(const UserName&)>& inOrder) {
    struct Seen {
        size_t contacts = 0;
        bool other = false;
    };
    std::unordered_map<UserName, Seen> seen;
    for (const CXDChangeRecordPtr& record : records) {
        if (!record->user()) continue;
        Seen& before = seen[*record->user()];
        if (isContact(*record)) ++before.contacts;
        if (comesBehindTheList(*record)) before.other = true;
        if (!isListOfEverybody(*record)) continue;
        if (const auto known = _trees.find(*record->user()); known != _trees.end()) {
            const Lock guard(known->second->lock);
            if (!before.other) ++known->second->lists; // a change that waited, and a new one
            continue;
        }
        if (!inOrder(*record->user())) continue;
        Tree& tree = *_trees.emplace(*record->user(), std::make_unique<Tree>()).first->second;
        const Lock guard(tree.lock);
        tree.contacts = before.contacts;
        tree.lists = before.other ? 0 : 1; // nobody waits for one that is behind
    }
}

RecordTurns::Tree* RecordTurns::treeOf(const CXDChangeRecord& record) const {
    if (_trees.empty() || !record.user()) return nullptr;
    const auto found = _trees.find(*record.user());
    return found == _trees.end() ? nullptr : found->second.get();
}

bool RecordTurns::waitsForList(const CXDChangeRecord& record) const {
    return comesBehindTheList(record) && treeOf(record);
}

void RecordTurns::await(const CXDChangeRecord& record) const {
    if (Tree* tree = isListOfEverybody(record) || comesBehindTheList(record) ? treeOf(record) : nullptr) {
        Lock guard(tree->lock);
        const size_t& before = isListOfEverybody(record) ? tree->contacts : tree->lists;
        tree->changed.wait(guard, [&] { return before == 0; });
    }
    const auto turn = _turns.find(&record);
    if (turn != _turns.end() && turn->second.before) turn->second.before->wait();
}

void RecordTurns::done(const CXDChangeRecord& record) {
    if (Tree* tree = isContact(record) || isListOfEverybody(record) ? treeOf(record) : nullptr) {
        const Lock guard(tree->lock);
        size_t& left = isContact(record) ? tree->contacts : tree->lists;
        if (left > 0 && --left == 0) tree->changed.notify_all();
    }
    const auto turn = _turns.find(&record);
    if (turn != _turns.end()) turn->second.own->count_down();
}

} // namespace rolvane
