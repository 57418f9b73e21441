#include "engine/Mingler.h"

#include "engine/RecordIdentity.h"
#include "foundation/Log.h"

#include <algorithm>
#include <array>
#include <optional>
#include <vector>

namespace rolvane {

namespace {

bool isRemoval(const CXDChangeRecord& record) {
    return record.type() & kCXDRemovalBit;
}

template <class Text>
bool present(const std::optional<Text>& a, const std::optional<Text>& b) {
    return a && b && *a == *b;
}

bool personsContradict(const CXDChangeRecord& a, const CXDChangeRecord& b) {
    return present(a.person(), b.person()) && isRemoval(a) != isRemoval(b);
}

bool groupsContradict(const CXDChangeRecord& a, const CXDChangeRecord& b) {
    return present(a.group(), b.group()) && a.type() != CXDUpdateDistributionList &&
           b.type() != CXDUpdateDistributionList && isRemoval(a) != isRemoval(b);
}

enum class Outcome { nothing, elementLoses, recordLoses };

// The group test writes no "Rejecting" line: a group's contradictions come in crowds.
Outcome settle(const CXDChangeRecord& record, const CXDChangeRecord& element) {
    Outcome outcome = Outcome::nothing;
    if (personsContradict(record, element)) {
        CXDLog("Possible conflict:\n\t%@\n\t%@", record, element);
        if (record.changeMadeByDataOwner()) {
            CXDLog("Rejecting %@", element);
            outcome = Outcome::elementLoses;
        } else if (element.changeMadeByDataOwner()) {
            CXDLog("Rejecting %@", record);
            outcome = Outcome::recordLoses;
        }
    }
    if (groupsContradict(record, element)) {
        CXDLog("Possible conflict:\n\t%@\n\t%@", record, element);
        if (record.changeMadeByDataOwner())
            outcome = Outcome::elementLoses;
        else if (element.changeMadeByDataOwner())
            outcome = Outcome::recordLoses;
    }
    return outcome;
}

} // namespace

// The accepted records. Removing takes out whatever equals the record; the places are kept until the end.
class Mingler::List {
public:
    void append(const CXDChangeRecordPtr& record) {
        if (_indexed) _places.emplace(record, _records.size());
        _records.push_back(record);
    }
    void removeEqual(const CXDChangeRecordPtr& record) {
        if (!_indexed) buildIndex();
        const auto [first, last] = _places.equal_range(record);
        for (auto it = first; it != last; ++it) _records[it->second].reset();
        _places.erase(first, last);
    }
    CXDChangeRecords take() {
        _places.clear();
        _indexed = false;
        std::erase(_records, nullptr);
        return std::move(_records);
    }

private:
    void buildIndex() {
        for (size_t i = 0; i < _records.size(); ++i)
            if (_records[i]) _places.emplace(_records[i], i);
        _indexed = true;
    }
    CXDChangeRecords _records;
    std::unordered_multimap<CXDChangeRecordPtr, size_t, RecordHash, RecordEqual> _places;
    bool _indexed = false; // contradictions are rare: most passes never need the index
};

class Mingler::Bucket {
public:
    // mingleChangeRecord:from:withBucket:
    bool mingle(const CXDChangeRecordPtr& record, List& mingled, size_t indexFrom) {
        if (!_indexed && _elements.size() >= indexFrom) buildIndex();
        const bool accepted = _indexed ? passesIndex(record, mingled) : passesWalk(record, mingled);
        if (accepted) append(record);
        return accepted;
    }

private:
    using Place = size_t;
    // Ascending places; what has been removed since is dropped when it comes to the top.
    struct Candidates {
        std::vector<Place> owners, others;
    };
    using ByIdentifier = std::unordered_map<UniqueId, std::array<Candidates, 2>>; // [is a removal]

    bool passesWalk(const CXDChangeRecordPtr& record, List& mingled) {
        for (Place i = _elements.size(); i-- > 0;) {
            const CXDChangeRecordPtr element = _elements[i];
            if (element->isEqual(*record)) return false;
            const Outcome outcome = settle(*record, *element);
            if (outcome == Outcome::recordLoses) return false;
            if (outcome == Outcome::elementLoses) {
                _elements.erase(_elements.begin() + static_cast<std::ptrdiff_t>(i));
                mingled.removeEqual(element);
            }
        }
        return true;
    }

    // The same over the index: only elements behind the equal one (if there is one) are ever reached.
    bool passesIndex(const CXDChangeRecordPtr& record, List& mingled) {
        const auto equal = _equal.find(record);
        const std::optional<Place> stop = equal == _equal.end() ? std::nullopt : std::optional(equal->second);
        for (const Place place : candidates(*record, stop)) {
            const CXDChangeRecordPtr element = _elements[place];
            const Outcome outcome = settle(*record, *element);
            if (outcome == Outcome::recordLoses) return false;
            if (outcome == Outcome::elementLoses) {
                _equal.erase(element);
                _elements[place].reset();
                mingled.removeEqual(element);
            }
        }
        return !stop;
    }

    // What the walk would reach and contradict, latest first. Where only the outcome counts and nobody reads the log,
    // a subscriber's record needs no more than the latest contradiction of the owner.
    std::vector<Place> candidates(const CXDChangeRecord& record, std::optional<Place> stop) {
        const bool all = record.changeMadeByDataOwner() || debugLevel() != 0;
        std::vector<Place> found;
        const auto gather = [&](ByIdentifier& index, const std::optional<UniqueId>& identifier) {
            if (!identifier) return;
            const auto it = index.find(*identifier);
            if (it == index.end()) return;
            Candidates& opposite = it->second[isRemoval(record) ? 0 : 1];
            collect(opposite.owners, stop, all, found);
            if (all) collect(opposite.others, stop, all, found);
        };
        gather(_byPerson, record.person());
        if (record.type() != CXDUpdateDistributionList) gather(_byGroup, record.group());
        std::sort(found.begin(), found.end(), std::greater<>());
        found.erase(std::unique(found.begin(), found.end()), found.end());
        return found;
    }

    void collect(std::vector<Place>& places, std::optional<Place> stop, bool all, std::vector<Place>& found) {
        while (!places.empty() && !_elements[places.back()]) places.pop_back();
        for (auto it = places.rbegin(); it != places.rend() && (!stop || *it > *stop); ++it) {
            if (!_elements[*it]) continue;
            found.push_back(*it);
            if (!all) return;
        }
    }

    void append(const CXDChangeRecordPtr& record) {
        if (_indexed) index(record, _elements.size());
        _elements.push_back(record);
    }

    void buildIndex() {
        for (Place i = 0; i < _elements.size(); ++i) index(_elements[i], i);
        _indexed = true;
    }

    void index(const CXDChangeRecordPtr& record, Place place) {
        _equal.emplace(record, place);
        const auto add = [&](ByIdentifier& byIdentifier, const std::optional<UniqueId>& identifier) {
            if (!identifier) return;
            Candidates& same = byIdentifier[*identifier][isRemoval(*record) ? 1 : 0];
            (record->changeMadeByDataOwner() ? same.owners : same.others).push_back(place);
        };
        add(_byPerson, record->person());
        if (record->type() != CXDUpdateDistributionList) add(_byGroup, record->group());
    }

    CXDChangeRecords _elements; // with an index: null where an element was removed
    bool _indexed = false;
    std::unordered_map<CXDChangeRecordPtr, Place, RecordHash, RecordEqual> _equal;
    ByIdentifier _byPerson, _byGroup;
};

Mingler::Mingler(size_t indexFrom) : _indexFrom(indexFrom), _mingled(std::make_unique<List>()) {}
Mingler::~Mingler() = default;

bool Mingler::mingleIntoBucket(const UniqueId& identifier, const CXDChangeRecordPtr& record) {
    std::unique_ptr<Bucket>& bucket = _buckets[identifier];
    if (!bucket) bucket = std::make_unique<Bucket>();
    return bucket->mingle(record, *_mingled, _indexFrom);
}

bool Mingler::mingle(const CXDChangeRecordPtr& record) {
    bool accepted = false;
    if (record->person()) accepted = mingleIntoBucket(*record->person(), record);
    if (record->group()) accepted = mingleIntoBucket(*record->group(), record) || accepted;
    if (accepted) _mingled->append(record);
    return accepted;
}

CXDChangeRecords Mingler::takeMingled() {
    return _mingled->take();
}

} // namespace rolvane
