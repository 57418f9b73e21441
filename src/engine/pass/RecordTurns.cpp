#include "engine/pass/RecordTurns.h"

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

} // namespace

RecordTurns::RecordTurns(const CXDChangeRecords& records) {
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

void RecordTurns::await(const CXDChangeRecord& record) const {
    const auto turn = _turns.find(&record);
    if (turn != _turns.end() && turn->second.before) turn->second.before->wait();
}

void RecordTurns::done(const CXDChangeRecord& record) {
    const auto turn = _turns.find(&record);
    if (turn != _turns.end()) turn->second.own->count_down();
}

} // namespace rolvane
