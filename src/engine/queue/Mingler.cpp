#include "engine/queue/Mingler.h"

#include "contacts/records/Identifier.h"
#include "engine/queue/RecordIdentity.h"
#include "foundation/Log.h"
#include "foundation/NumberTable.h"

#include <algorithm>
#include <array>
#include <deque>
#include <functional>
#include <optional>
#include <unordered_map>
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

bool takesGroupOut(const CXDChangeRecord& record) {
    return record.type() == CXDDeleteGroup;
}

// Who leaves the all-contacts group leaves the database.
bool takesPersonOut(const CXDChangeRecord& record) {
    return record.type() == CXDDeleteRecord ||
           ((record.type() == CXDRemoveRecordFromGroup || record.type() == CXDRemoveGroupFromGroup) && record.group() &&
            record.group()->str() == kCXAllGroupUID);
}

// Two of the owner's changes stand side by side (somebody joins a group, somebody else leaves it, in one save), unless
// the later one undoes the earlier: it concerns the same member of the same group, or one of them takes out of the
// database what the other changes.
bool areOwnersBoth(const CXDChangeRecord& a, const CXDChangeRecord& b) {
    return a.changeMadeByDataOwner() && b.changeMadeByDataOwner();
}

bool personsContradict(const CXDChangeRecord& a, const CXDChangeRecord& b) {
    return isRemoval(a) != isRemoval(b) && present(a.person(), b.person()) &&
           (!areOwnersBoth(a, b) || a.group() == b.group() || takesPersonOut(a) || takesPersonOut(b));
}

bool groupsContradict(const CXDChangeRecord& a, const CXDChangeRecord& b) {
    return isRemoval(a) != isRemoval(b) && a.type() != CXDUpdateDistributionList &&
           b.type() != CXDUpdateDistributionList && present(a.group(), b.group()) &&
           (!areOwnersBoth(a, b) || takesGroupOut(a) || takesGroupOut(b));
}

enum class Outcome { nothing, elementLoses, recordLoses };

// The group test writes no "Rejecting" line: a group's contradictions come in crowds.
Outcome judge(const CXDChangeRecord& record, const CXDChangeRecord& element) {
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

uint32_t folded(size_t hash) {
    return static_cast<uint32_t>(hash ^ (hash >> 32));
}

constexpr uint32_t kNone = NumberTable::kNone;

} // namespace

// The accepted records in order, numbered. Removing takes out whatever equals the record; the numbers stay.
class Mingler::List {
public:
    uint32_t next() const { return static_cast<uint32_t>(_records.size()); }
    void expect(size_t more) { _records.reserve(_records.size() + more); }
    const CXDChangeRecordPtr& operator[](uint32_t number) const { return _records[number]; }
    void append(const CXDChangeRecordPtr& record) {
        if (_indexed) _equal.emplace(record, next());
        _records.push_back(record);
    }
    void removeEqual(const CXDChangeRecordPtr& record) {
        if (!_indexed) buildIndex();
        _removed.resize(_records.size());
        const auto [first, last] = _equal.equal_range(record);
        for (auto it = first; it != last; ++it) _removed[it->second] = true;
        _equal.erase(first, last);
    }
    CXDChangeRecords take() {
        _equal.clear();
        _indexed = false;
        if (!_removed.empty()) {
            _removed.resize(_records.size());
            size_t i = 0;
            std::erase_if(_records, [&](const CXDChangeRecordPtr&) { return _removed[i++]; });
        }
        return std::move(_records);
    }

private:
    void buildIndex() {
        for (uint32_t i = 0; i < _records.size(); ++i) _equal.emplace(_records[i], i);
        _indexed = true;
    }
    CXDChangeRecords _records;
    std::vector<bool> _removed; // empty while nothing is
    std::unordered_multimap<CXDChangeRecordPtr, uint32_t, RecordHash, RecordEqual> _equal;
    bool _indexed = false; // contradictions are rare: most passes never need the index
};

// The elements of all buckets. Those of one bucket are chained from the latest to the earliest.
class Mingler::Elements {
public:
    // The record lies far away in memory; with its hash and kind at hand, few elements need a look at it.
    struct Element {
        uint32_t record; // its number in the list; kNone after the removal
        uint32_t previous;
        uint32_t hash;
        bool isRemoval;
    };
    Element& operator[](uint32_t element) { return _elements[element]; }
    void expect(size_t more) { _elements.reserve(_elements.size() + more); }
    uint32_t add(const Element& element) {
        _elements.push_back(element);
        return static_cast<uint32_t>(_elements.size() - 1);
    }

private:
    std::vector<Element> _elements;
};

// What a long bucket is searched by.
class Mingler::Index {
public:
    Index(const List& list, Elements& elements, size_t& looks) : _list(list), _elements(elements), _looks(looks) {}

    void add(uint32_t element) {
        _equal.add(_elements[element].hash, element);
        _all.push_back(element);
        ++(_elements[element].isRemoval ? _removals : _others);
        if (_byIdentifierBuilt) addByIdentifier(element);
    }
    void remove(uint32_t element) { _elements[element].record = kNone; }

    uint32_t findEqual(const CXDChangeRecord& record, uint32_t hash) const {
        return _equal.find(hash, [&](uint32_t element) {
            ++_looks;
            return _elements[element].record != kNone && recordOf(element).isEqual(record);
        });
    }

    // The elements behind `stop` that the walk would reach and that contradict, latest first. Where only the outcome
    // counts and nobody reads the log, a subscriber's record needs no more than the latest contradiction of the owner.
    std::vector<uint32_t> candidates(const CXDChangeRecord& record, uint32_t stop) {
        std::vector<uint32_t> found;
        if ((isRemoval(record) ? _others : _removals) == 0) return found; // nothing here can contradict it
        if (!_byIdentifierBuilt) buildByIdentifier();
        const bool isOwners = record.changeMadeByDataOwner();
        const bool all = isOwners || debugLevel() != 0;
        const auto gather = [&](ByIdentifier& index, const std::optional<UniqueId>& identifier, bool onlyTakers) {
            if (!identifier) return;
            const auto it = index.find(*identifier);
            if (it == index.end()) return;
            Candidates& opposite = it->second[isRemoval(record) ? 0 : 1];
            collect(onlyTakers ? opposite.takers : opposite.owners, stop, all, found);
            if (all) collect(opposite.others, stop, all, found);
        };
        gather(_byPerson, record.person(), false);
        // A group has many members, and few of its owner's changes touch each other.
        if (record.type() != CXDUpdateDistributionList)
            gather(_byGroup, record.group(), isOwners && !takesGroupOut(record));
        std::sort(found.begin(), found.end(), std::greater<>());
        found.erase(std::unique(found.begin(), found.end()), found.end());
        return found;
    }

private:
    // Ascending; what has been removed since is dropped when it comes to the top.
    struct Candidates {
        std::vector<uint32_t> owners, others;
        std::vector<uint32_t> takers; // of the owners': what takes the group out
    };
    using ByIdentifier = std::unordered_map<UniqueId, std::array<Candidates, 2>>; // [is a removal]

    const CXDChangeRecord& recordOf(uint32_t element) const { return *_list[_elements[element].record]; }

    void collect(std::vector<uint32_t>& elements, uint32_t stop, bool all, std::vector<uint32_t>& found) {
        while (!elements.empty() && _elements[elements.back()].record == kNone) elements.pop_back();
        for (auto it = elements.rbegin(); it != elements.rend() && (stop == kNone || *it > stop); ++it) {
            ++_looks;
            if (_elements[*it].record == kNone) continue;
            found.push_back(*it);
            if (!all) return;
        }
    }
    void buildByIdentifier() {
        for (const uint32_t element : _all)
            if (_elements[element].record != kNone) addByIdentifier(element);
        _byIdentifierBuilt = true;
    }
    void addByIdentifier(uint32_t element) {
        const CXDChangeRecord& record = recordOf(element);
        const auto add = [&](ByIdentifier& index, const std::optional<UniqueId>& identifier) {
            if (!identifier) return;
            Candidates& same = index[*identifier][isRemoval(record) ? 1 : 0];
            (record.changeMadeByDataOwner() ? same.owners : same.others).push_back(element);
            if (record.changeMadeByDataOwner() && takesGroupOut(record)) same.takers.push_back(element);
        };
        add(_byPerson, record.person());
        if (record.type() != CXDUpdateDistributionList) add(_byGroup, record.group());
    }

    const List& _list;
    Elements& _elements;
    size_t& _looks;
    NumberTable _equal;
    std::vector<uint32_t> _all; // ascending
    size_t _removals = 0, _others = 0;
    bool _byIdentifierBuilt = false; // only needed where removals meet what is none
    ByIdentifier _byPerson, _byGroup;
};

struct Mingler::Bucket {
    const UniqueId* identifier; // of its first record: an empty bucket accepts anything, so the list holds that one
    uint32_t last = kNone;      // element
    uint32_t count = 0;         // removed ones included
    std::unique_ptr<Index> index;
};

class Mingler::Buckets {
public:
    explicit Buckets(size_t indexFrom) : _indexFrom(indexFrom) {}

    // mingleChangeRecord:from:withBucket: of the identifier's bucket.
    bool mingle(const UniqueId& identifier, const CXDChangeRecord& record, uint32_t hash) {
        Bucket& bucket = bucketOf(identifier);
        if (!bucket.index && bucket.count >= _indexFrom) buildIndex(bucket);
        const bool accepted =
            bucket.index ? passesIndex(*bucket.index, record, hash) : passesWalk(bucket, record, hash);
        if (accepted) _justAccepted.push_back(&bucket);
        return accepted;
    }
    void expect(size_t records) {
        list.expect(records);
        _elements.expect(2 * records); // a person's and a group's
    }
    void prefetchSlotOf(const UniqueId& identifier) const { _byIdentifier.prefetch(identifier.text().hash()); }
    // To be called when the record has passed its buckets.
    bool appendIfAccepted(const CXDChangeRecordPtr& record, uint32_t hash) {
        if (_justAccepted.empty()) return false;
        const uint32_t number = list.next();
        list.append(record);
        for (Bucket* bucket : _justAccepted) {
            bucket->last = _elements.add({number, bucket->last, hash, isRemoval(*record)});
            ++bucket->count;
            if (bucket->index) bucket->index->add(bucket->last);
        }
        _justAccepted.clear();
        return true;
    }

    List list;
    size_t looks = 0;

private:
    Bucket& bucketOf(const UniqueId& identifier) {
        const uint32_t hash = identifier.text().hash();
        const uint32_t known =
            _byIdentifier.find(hash, [&](uint32_t number) { return *_buckets[number].identifier == identifier; });
        if (known != kNone) return _buckets[known];
        _byIdentifier.add(hash, static_cast<uint32_t>(_buckets.size()));
        _buckets.push_back({&identifier, kNone, 0, nullptr});
        return _buckets.back();
    }

    bool passesWalk(Bucket& bucket, const CXDChangeRecord& record, uint32_t hash) {
        uint32_t* link = &bucket.last;
        while (*link != kNone) {
            ++looks;
            Elements::Element& element = _elements[*link];
            const bool mayContradict = element.isRemoval != isRemoval(record);
            if (!mayContradict && element.hash == hash && list[element.record]->isEqual(record)) return false;
            const Outcome outcome = mayContradict ? judge(record, *list[element.record]) : Outcome::nothing;
            if (outcome == Outcome::recordLoses) return false;
            if (outcome == Outcome::elementLoses) {
                list.removeEqual(list[element.record]);
                *link = element.previous;
                --bucket.count;
            } else {
                link = &element.previous;
            }
        }
        return true;
    }

    // The same over the index: only elements behind the equal one (if there is one) are ever reached.
    bool passesIndex(Index& index, const CXDChangeRecord& record, uint32_t hash) {
        const uint32_t stop = index.findEqual(record, hash);
        for (const uint32_t candidate : index.candidates(record, stop)) {
            const CXDChangeRecordPtr& element = list[_elements[candidate].record];
            const Outcome outcome = judge(record, *element);
            if (outcome == Outcome::recordLoses) return false;
            if (outcome == Outcome::elementLoses) {
                list.removeEqual(element);
                index.remove(candidate);
            }
        }
        return stop == kNone;
    }

    void buildIndex(Bucket& bucket) {
        bucket.index = std::make_unique<Index>(list, _elements, looks);
        std::vector<uint32_t> elements;
        for (uint32_t i = bucket.last; i != kNone; i = _elements[i].previous) elements.push_back(i);
        for (auto it = elements.rbegin(); it != elements.rend(); ++it) bucket.index->add(*it);
    }

    size_t _indexFrom;
    Elements _elements;
    NumberTable _byIdentifier;
    std::deque<Bucket> _buckets; // stay where they are
    std::vector<Bucket*> _justAccepted;
};

Mingler::Mingler(size_t indexFrom) : _buckets(std::make_unique<Buckets>(indexFrom)) {}
Mingler::~Mingler() = default;

bool Mingler::mingle(const CXDChangeRecordPtr& record) {
    const uint32_t hash = folded(RecordHash()(*record));
    const bool accepted = record->person() && _buckets->mingle(*record->person(), *record, hash);
    // In a bucket that has just accepted it, it would meet itself.
    if (record->group() && !(accepted && record->group() == record->person()))
        _buckets->mingle(*record->group(), *record, hash);
    return _buckets->appendIfAccepted(record, hash);
}

// Persons come in an order of their own: a record, its identifier and the identifier's slot in the table each lie far
// away in memory from the ones before.
void Mingler::mingle(const CXDChangeRecords& records) {
    constexpr size_t kSlotAhead = 6, kIdentifierAhead = 12, kRecordAhead = 24;
    const auto personAt = [&](size_t i) -> const UniqueId* {
        return i < records.size() && records[i]->person() ? &*records[i]->person() : nullptr;
    };
    _buckets->expect(records.size());
    for (size_t i = 0; i < records.size(); ++i) {
        if (i + kRecordAhead < records.size()) __builtin_prefetch(records[i + kRecordAhead].get());
        if (const UniqueId* person = personAt(i + kIdentifierAhead)) person->text().prefetch();
        if (const UniqueId* person = personAt(i + kSlotAhead)) _buckets->prefetchSlotOf(*person);
        mingle(records[i]);
    }
}

size_t Mingler::elementsLookedAt() const {
    return _buckets->looks;
}

CXDChangeRecords Mingler::takeMingled() {
    return _buckets->list.take();
}

} // namespace rolvane
