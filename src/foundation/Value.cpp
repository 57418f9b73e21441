#include "foundation/Value.h"

#include <algorithm>
#include <atomic>
#include <bit>
#include <charconv>
#include <cmath>
#include <fmt/format.h>
#include <memory>
#include <mutex>

namespace rolvane {

namespace {

const Value kAbsent;
constexpr size_t kIndexFrom = 24;               // below this a linear search is as fast as the index
constexpr size_t kMostIndexed = UINT32_MAX - 2; // places have 32 bits
constexpr size_t kAhead = 4;                    // removals whose places in the index are under way from memory

// Tells that two containers have the same content without a look at it. A copy that was made by deepMutableCopy has the
// number of its original until one of the two changes. Two dictionaries of dictionaries get one number when they were
// found equal. The dictionaries inside change by themselves, perhaps in another's hand. So each of them knows that it
// is inside, and its change makes the numbers of all dictionaries of dictionaries void. That is seldom: what stands
// inside is mostly replaced as a whole.
class ContentMark {
public:
    void changes() {
        _number.store(0, std::memory_order_relaxed);
        if (!_isInside.load(std::memory_order_relaxed)) return;
        const uint64_t now = next();
        uint64_t last = lastInside().load(std::memory_order_relaxed);
        while (last < now && !lastInside().compare_exchange_weak(last, now, std::memory_order_relaxed)) {
        }
    }
    void goInside() { _isInside.store(true, std::memory_order_relaxed); }
    // `holdsContainers`: each of them knows by now that it is inside.
    void become(ContentMark& original, bool holdsContainers) {
        _number.store(original.number(holdsContainers), std::memory_order_relaxed);
    }
    bool isThatOf(const ContentMark& other) const {
        const uint64_t own = _number.load(std::memory_order_relaxed);
        return own != 0 && own == other._number.load(std::memory_order_relaxed) && isValid(own);
    }

private:
    static constexpr uint64_t kHoldsContainers = 1;

    static uint64_t next() { // another one each time, and greater
        static std::atomic<uint64_t> last{0};
        return last.fetch_add(2, std::memory_order_relaxed) + 2;
    }
    static std::atomic<uint64_t>& lastInside() { // the last change of a container in another one
        static std::atomic<uint64_t> one{0};
        return one;
    }
    static bool isValid(uint64_t number) {
        return (number & kHoldsContainers) == 0 || number > lastInside().load(std::memory_order_relaxed);
    }
    uint64_t number(bool holdsContainers) { // readers on several threads may ask for the first time at once
        uint64_t held = _number.load(std::memory_order_relaxed);
        if (held != 0 && isValid(held)) return held;
        const uint64_t fresh = next() | (holdsContainers ? kHoldsContainers : 0);
        return _number.compare_exchange_strong(held, fresh) ? fresh : held;
    }
    std::atomic<uint64_t> _number{0}; // 0: nothing is known
    std::atomic<bool> _isInside{false};
};

bool isContainer(const Value& value) {
    return value.isArray() || value.isDictionary();
}

} // namespace

// An open-addressed table from a string's hash to the places of the strings that have it. It holds no text: whoever
// asks compares what stands at the place.
class Places {
public:
    static constexpr uint32_t kEmpty = UINT32_MAX, kGone = UINT32_MAX - 1;

    explicit Places(size_t expected) { resize(expected); }

    void add(uint32_t hash, uint32_t place) {
        if ((_used + 1) * 2 > _slots.size()) grow();
        put(hash, place);
        ++_used;
    }
    // Calls with each place of the hash until the call says true; `erase` frees the slots for which it says so.
    template <class Call>
    bool find(uint32_t hash, Call&& call) const {
        for (size_t i = hash & mask(); _slots[i].place != kEmpty; i = (i + 1) & mask())
            if (_slots[i].hash == hash && _slots[i].place != kGone && call(_slots[i].place)) return true;
        return false;
    }
    template <class Call>
    void eraseIf(uint32_t hash, Call&& call) {
        for (size_t i = hash & mask(); _slots[i].place != kEmpty; i = (i + 1) & mask())
            if (_slots[i].hash == hash && _slots[i].place != kGone && call(_slots[i].place)) _slots[i].place = kGone;
    }
    // The hash is likely to be asked for soon: its slot is fetched meanwhile.
    void expect(uint32_t hash) const { __builtin_prefetch(&_slots[hash & mask()], 1); }

private:
    struct Slot {
        uint32_t hash = 0, place = kEmpty;
    };
    size_t mask() const { return _slots.size() - 1; }
    void resize(size_t expected) { _slots.assign(std::bit_ceil(std::max<size_t>(expected * 2, 16)), Slot()); }
    void put(uint32_t hash, uint32_t place) {
        size_t i = hash & mask();
        while (_slots[i].place != kEmpty) i = (i + 1) & mask();
        _slots[i] = {hash, place};
    }
    void grow() {
        std::vector<Slot> before = std::move(_slots);
        const auto isLive = [](const Slot& s) { return s.place < kGone; };
        _used = static_cast<size_t>(std::count_if(before.begin(), before.end(), isLive));
        resize(_used * 2);
        for (const Slot& s : before)
            if (isLive(s)) put(s.hash, s.place);
    }

    std::vector<Slot> _slots; // a power of two, at most half of it used
    size_t _used = 0;         // gone ones included
};

// `index` knows the places of the string elements: built on first need, dropped when the elements move. Readers on
// several threads may need it at once: each builds its own and the first one to finish is kept.
//
// `gaps` are the places that removeAll has emptied; `gapCount` is their number. The first look at the order closes
// them. That is a write within a reading operation: while there are gaps, readers take turns.
struct Array::Storage : SharedObject {
    std::vector<Value> items;
    std::vector<uint32_t> gaps;
    std::atomic<size_t> gapCount{0};
    std::atomic<Places*> index{nullptr};
    ContentMark mark;

    ~Storage() override { delete index.load(); }

    // What an operation that reads and leaves the gaps holds meanwhile.
    std::unique_lock<std::mutex> turn() const {
        return gapCount.load(std::memory_order_acquire) == 0 ? std::unique_lock<std::mutex>()
                                                             : std::unique_lock(turns());
    }
    static std::mutex& turns() {
        static std::mutex one; // of all arrays: gaps are rare
        return one;
    }
    size_t count() const { return items.size() - gapCount.load(std::memory_order_relaxed); }
    bool isIndexed() const { return count() >= kIndexFrom && items.size() < kMostIndexed; }

    const Places& indexed() {
        if (const Places* built = index.load(std::memory_order_acquire)) return *built;
        auto fresh = std::make_unique<Places>(items.size());
        for (size_t i = 0; i < items.size(); ++i) {
            expect(*fresh, i + kAhead);
            if (const SharedText* s = items[i].textIf()) fresh->add(s->hash(), static_cast<uint32_t>(i));
        }
        Places* none = nullptr;
        if (index.compare_exchange_strong(none, fresh.get(), std::memory_order_acq_rel)) return *fresh.release();
        return *none;
    }
    void appended() {
        Places* built = index.load();
        const SharedText* s = items.back().textIf();
        if (built && s) built->add(s->hash(), static_cast<uint32_t>(items.size() - 1));
    }
    void dropIndex() { delete index.exchange(nullptr); }

    void takeOut(const SharedText& text) {
        mark.changes();
        indexed();
        Places& places = *index.load();
        places.eraseIf(text.hash(), [&](uint32_t place) {
            if (const SharedText* held = items[place].textIf(); !held || *held != text) return false;
            items[place] = Value();
            gaps.push_back(place);
            return true;
        });
        gapCount.store(gaps.size(), std::memory_order_release);
        if (!gaps.empty()) expect(places, gaps.back() + kAhead);
    }
    // A large index is in no near cache, and who takes out one element after the other mostly does so in their order.
    void expect(const Places& places, size_t place) const {
        const SharedText* next = place < items.size() ? items[place].textIf() : nullptr;
        if (!next) return;
        places.expect(next->hash());
        __builtin_prefetch(next->str().data());
    }
    void closeGaps() {
        const std::lock_guard guard(turns());
        if (gapCount.load(std::memory_order_relaxed) == 0) return;
        if (!std::is_sorted(gaps.begin(), gaps.end())) std::sort(gaps.begin(), gaps.end());
        size_t to = gaps.front(), gap = 0;
        for (size_t from = to; from < items.size(); ++from) {
            if (gap < gaps.size() && gaps[gap] == from)
                ++gap;
            else
                items[to++] = std::move(items[from]);
        }
        items.resize(to);
        gaps.clear();
        dropIndex();
        gapCount.store(0, std::memory_order_release);
    }
};

struct Dictionary::Storage : SharedObject {
    static constexpr size_t kMany = 8; // from so many dictionaries on a note is worth its while
    Map map;
    ContentMark mark;

    bool holdsContainers() const {
        return std::any_of(map.begin(), map.end(), [](const auto& entry) { return isContainer(entry.second); });
    }
    bool isOfPlainDictionaries() const {
        return std::all_of(map.begin(), map.end(), [](const auto& entry) {
            const Dictionary* inner = entry.second.dictionaryIf();
            return inner && !inner->_p->holdsContainers();
        });
    }
    static void noteEqual(Storage& a, Storage& b) {
        if (a.map.size() < kMany || !a.isOfPlainDictionaries()) return;
        for (const Storage* each : {&a, &b})
            for (const auto& [key, inner] : each->map) inner.dictionaryIf()->_p->mark.goInside();
        b.mark.become(a.mark, true);
    }
};

Array::Array() : _p(new Storage) {}
Array::Array(std::initializer_list<Value> values) : Array() {
    _p->items.assign(values);
}
Array::Array(std::vector<Value> values) : Array() {
    _p->items = std::move(values);
}

const std::vector<Value>& Array::items() const {
    if (_p->gapCount.load(std::memory_order_acquire) != 0) _p->closeGaps();
    return _p->items;
}

size_t Array::count() const {
    const auto turn = _p->turn();
    return _p->count();
}
std::vector<Value>::const_iterator Array::begin() const {
    return items().begin();
}
std::vector<Value>::const_iterator Array::end() const {
    return items().end();
}
void Array::reserve(size_t n) {
    _p->items.reserve(n);
}

const Value& Array::operator[](size_t i) const {
    if (i >= count())
        throw CXException(kCXRangeException, fmt::format("index {} is beyond the end of an array of {}", i, count()));
    return items()[i];
}

void Array::append(Value v) {
    _p->mark.changes();
    _p->items.push_back(std::move(v));
    _p->appended();
}

void Array::appendAll(const Array& other) {
    const size_t n = other.items().size(); // other may be this very array
    const size_t all = _p->items.size() + n;
    if (all > _p->items.capacity()) _p->items.reserve(std::max(all, _p->items.capacity() * 2));
    for (size_t i = 0; i < n; ++i) append(other._p->items[i]);
}

void Array::insert(size_t index, Value v) {
    if (index == count()) return append(std::move(v));
    if (index > count())
        throw CXException(kCXRangeException,
                          fmt::format("index {} is beyond the end of an array of {}", index, count()));
    items(); // closes the gaps
    _p->mark.changes();
    _p->dropIndex();
    _p->items.insert(_p->items.begin() + static_cast<std::ptrdiff_t>(index), std::move(v));
}

void Array::replace(size_t index, Value v) {
    (*this)[index];
    _p->mark.changes();
    _p->dropIndex();
    _p->items[index] = std::move(v);
}

void Array::removeAt(size_t index) {
    (*this)[index];
    _p->mark.changes();
    _p->dropIndex();
    _p->items.erase(_p->items.begin() + static_cast<std::ptrdiff_t>(index));
}

void Array::removeAll(const Value& v) {
    const Value wanted = v; // NOLINT(performance-unnecessary-copy-initialization): v may live inside this array
    const SharedText* text = wanted.textIf();
    if (text && _p->isIndexed()) return _p->takeOut(*text);
    items(); // closes the gaps
    _p->mark.changes();
    if (std::erase(_p->items, wanted) != 0) _p->dropIndex();
}

void Array::removeAllOf(const Array& others) {
    if (others.empty()) return;
    const Array gone = others.isSame(*this) ? others.mutableCopy() : others;
    items(); // closes the gaps
    _p->mark.changes();
    if (std::erase_if(_p->items, [&](const Value& v) { return gone.contains(v); }) != 0) _p->dropIndex();
}

bool Array::contains(const Value& v) const {
    const SharedText* text = v.textIf();
    if (!text) return std::find(begin(), end(), v) != end();
    const auto turn = _p->turn();
    const auto isIt = [&](const Value& held) { return held.textIf() && *held.textIf() == *text; };
    if (!_p->isIndexed()) return std::any_of(_p->items.begin(), _p->items.end(), isIt);
    return _p->indexed().find(text->hash(), [&](uint32_t place) { return isIt(_p->items[place]); });
}

bool Array::containsString(std::string_view s) const {
    const auto turn = _p->turn();
    const auto isIt = [&](const Value& held) { return held.stringIf() && *held.stringIf() == s; };
    if (!_p->isIndexed()) return std::any_of(_p->items.begin(), _p->items.end(), isIt);
    return _p->indexed().find(SharedText::hashOf(s), [&](uint32_t place) { return isIt(_p->items[place]); });
}

std::optional<size_t> Array::indexOf(const Value& v) const {
    if (v.isString() && !contains(v)) return std::nullopt;
    const auto it = std::find(begin(), end(), v);
    if (it == end()) return std::nullopt;
    return static_cast<size_t>(it - begin());
}

Array Array::mutableCopy() const {
    Array copy(items());
    if (std::none_of(_p->items.begin(), _p->items.end(), isContainer)) copy._p->mark.become(_p->mark, false);
    return copy;
}

bool operator==(const Array& a, const Array& b) {
    return a._p == b._p || a._p->mark.isThatOf(b._p->mark) || a.items() == b.items();
}

Dictionary::Dictionary() : _p(new Storage) {}
Dictionary::Dictionary(std::initializer_list<DictionaryEntry> entries) : Dictionary() {
    for (const auto& [key, value] : entries) set(key, value);
}

bool Dictionary::isSame(const Dictionary& other) const {
    return _p == other._p;
}
size_t Dictionary::count() const {
    return _p->map.size();
}
Dictionary::const_iterator Dictionary::begin() const {
    return _p->map.begin();
}
Dictionary::const_iterator Dictionary::end() const {
    return _p->map.end();
}

const Value& Dictionary::operator[](std::string_view key) const {
    const auto it = _p->map.find(key);
    return it == _p->map.end() ? kAbsent : it->second;
}

bool Dictionary::contains(std::string_view key) const {
    return _p->map.find(key) != _p->map.end();
}

void Dictionary::set(std::string_view key, Value v) {
    if (v.isAbsent())
        throw CXException(kCXInvalidArgumentException,
                          fmt::format("an absent value cannot be stored in a dictionary (key \"{}\")", key));
    _p->mark.changes();
    if (auto it = _p->map.find(key); it != _p->map.end())
        it->second = std::move(v);
    else
        _p->map.emplace(std::string(key), std::move(v));
}

bool Dictionary::setIfNew(std::string&& key, Value v) {
    if (v.isAbsent())
        throw CXException(kCXInvalidArgumentException,
                          fmt::format("an absent value cannot be stored in a dictionary (key \"{}\")", key));
    _p->mark.changes();
    const size_t before = _p->map.size();
    _p->map.try_emplace(_p->map.end(), std::move(key), std::move(v)); // the hint makes ascending keys cheap
    return _p->map.size() != before;
}

void Dictionary::remove(std::string_view key) {
    _p->mark.changes();
    if (auto it = _p->map.find(key); it != _p->map.end()) _p->map.erase(it);
}

void Dictionary::addEntriesFrom(const Dictionary& other) {
    if (other.isSame(*this)) return;
    for (const auto& [key, value] : other) set(key, value);
}

std::vector<std::string> Dictionary::allKeys() const {
    std::vector<std::string> keys;
    keys.reserve(count());
    for (const auto& entry : _p->map) keys.push_back(entry.first);
    return keys;
}

Dictionary Dictionary::dictionaryFor(std::string_view key) {
    if (const Dictionary* held = (*this)[key].dictionaryIf()) return *held;
    Dictionary made;
    set(key, made);
    return made;
}

Array Dictionary::arrayFor(std::string_view key) {
    if (const Array* held = (*this)[key].arrayIf()) return *held;
    Array made;
    set(key, made);
    return made;
}

Dictionary Dictionary::mutableCopy() const {
    Dictionary copy;
    copy._p->map = _p->map;
    if (std::none_of(begin(), end(), [](const auto& entry) { return isContainer(entry.second); }))
        copy._p->mark.become(_p->mark, false);
    return copy;
}

bool operator==(const Dictionary& a, const Dictionary& b) {
    if (a._p == b._p || a._p->mark.isThatOf(b._p->mark)) return true;
    if (a._p->map != b._p->map) return false;
    Dictionary::Storage::noteEqual(*a._p, *b._p);
    return true;
}

bool Value::boolean(bool otherwise) const {
    if (const auto* b = std::get_if<bool>(&_v)) return *b;
    if (const auto* i = std::get_if<int64_t>(&_v)) return *i != 0;
    if (const auto* d = std::get_if<double>(&_v)) return *d != 0;
    return otherwise;
}

int64_t Value::integer(int64_t otherwise) const {
    if (const auto* i = std::get_if<int64_t>(&_v)) return *i;
    if (const auto* b = std::get_if<bool>(&_v)) return *b ? 1 : 0;
    if (const auto* d = std::get_if<double>(&_v))
        return std::isfinite(*d) && std::abs(*d) < 9.2e18 ? static_cast<int64_t>(*d) : otherwise;
    if (const std::string* s = stringIf()) {
        int64_t n = 0;
        const auto [end, error] = std::from_chars(s->data(), s->data() + s->size(), n);
        if (error == std::errc() && end == s->data() + s->size()) return n;
    }
    return otherwise;
}

double Value::real(double otherwise) const {
    if (const auto* d = std::get_if<double>(&_v)) return *d;
    if (const auto* i = std::get_if<int64_t>(&_v)) return static_cast<double>(*i);
    return otherwise;
}

const std::string* Value::stringIf() const {
    const SharedText* s = textIf();
    return s ? &s->str() : nullptr;
}

const std::string& Value::string() const {
    static const std::string empty;
    const std::string* s = stringIf();
    return s ? *s : empty;
}

std::optional<std::string> Value::optionalString() const {
    const std::string* s = stringIf();
    return s ? std::optional<std::string>(*s) : std::nullopt;
}

std::optional<Date> Value::date() const {
    const auto* d = std::get_if<Date>(&_v);
    return d ? std::optional<Date>(*d) : std::nullopt;
}

const Bytes& Value::data() const {
    static const Bytes empty;
    const auto* b = std::get_if<SharedPointer<SharedBytes>>(&_v);
    return b ? (*b)->bytes : empty;
}

Array Value::array() const {
    const Array* a = arrayIf();
    return a ? *a : Array();
}

Dictionary Value::dictionary() const {
    const Dictionary* d = dictionaryIf();
    return d ? *d : Dictionary();
}

Value Value::deepMutableCopy() const {
    if (const Array* a = arrayIf()) {
        if (std::none_of(a->begin(), a->end(), isContainer)) return a->mutableCopy();
        std::vector<Value> items;
        items.reserve(a->count());
        for (const Value& v : *a) items.push_back(v.deepMutableCopy());
        return Array(std::move(items));
    }
    if (const Dictionary* d = dictionaryIf()) {
        if (std::none_of(d->begin(), d->end(), [](const auto& entry) { return isContainer(entry.second); }))
            return d->mutableCopy();
        Dictionary copy;
        for (const auto& [key, value] : *d) copy.set(key, value.deepMutableCopy());
        return copy;
    }
    return *this;
}

namespace {

constexpr int kShownDepth = 64; // a container may hold itself

void describe(const Value& v, int depth, std::string& out) {
    if (depth > kShownDepth) {
        out += "...";
        return;
    }
    const std::string pad(static_cast<size_t>(depth) * 4, ' ');
    switch (v.type()) {
    case ValueType::absent: out += "(null)"; break;
    case ValueType::boolean: out += v.boolean() ? "true" : "false"; break;
    case ValueType::integer: out += fmt::format("{}", v.integer()); break;
    case ValueType::real: out += fmt::format("{}", v.real()); break;
    case ValueType::string: depth == 0 ? out += v.string() : out += '"' + v.string() + '"'; break;
    case ValueType::date: out += v.date()->toISO8601(); break;
    case ValueType::data: out += fmt::format("<{} bytes>", v.data().size()); break;
    case ValueType::array:
        out += "(\n";
        for (const Value& item : *v.arrayIf()) {
            out += pad + "    ";
            describe(item, depth + 1, out);
            out += ",\n";
        }
        out += pad + ")";
        break;
    case ValueType::dictionary:
        out += "{\n";
        for (const auto& [key, item] : *v.dictionaryIf()) {
            out += pad + "    \"" + key + "\" = ";
            describe(item, depth + 1, out);
            out += ";\n";
        }
        out += pad + "}";
        break;
    }
}

} // namespace

std::string Value::description() const {
    std::string out;
    describe(*this, 0, out);
    return out;
}

namespace {

// Exactly: 2^53 + 1 has no real of its own and equals none. Converting the real is defined only within the range.
bool isNumberOf(int64_t i, double d) {
    return d >= -9223372036854775808.0 && d < 9223372036854775808.0 && static_cast<double>(i) == d &&
           static_cast<int64_t>(d) == i;
}

} // namespace

bool operator==(const Value& a, const Value& b) {
    if (a.type() == ValueType::integer && b.type() == ValueType::real) return isNumberOf(a.integer(), b.real());
    if (a.type() == ValueType::real && b.type() == ValueType::integer) return isNumberOf(b.integer(), a.real());
    if (a.type() != b.type()) return false;
    switch (a.type()) {
    case ValueType::string: return *a.textIf() == *b.textIf();
    case ValueType::data: return a.data() == b.data();
    case ValueType::array: return *a.arrayIf() == *b.arrayIf();
    case ValueType::dictionary: return *a.dictionaryIf() == *b.dictionaryIf();
    default: return a._v == b._v;
    }
}

Array cxArrayCombinedWithArray(const Array& a, const Array& b) {
    Array all = a.mutableCopy();
    for (const Value& v : b)
        if (!all.contains(v)) all.append(v);
    return all;
}

// What the two have in common at the front and at the back needs no look-up; between equal lists nothing is left.
Dictionary cxDifferencesBetweenArray(const Array& prior, const Array& current) {
    const auto same = std::mismatch(prior.begin(), prior.end(), current.begin(), current.end());
    auto priorEnd = prior.end(), currentEnd = current.end();
    while (priorEnd != same.first && currentEnd != same.second && *(priorEnd - 1) == *(currentEnd - 1)) {
        --priorEnd;
        --currentEnd;
    }
    Array additions, deletions;
    for (auto v = same.second; v != currentEnd; ++v)
        if (!prior.contains(*v)) additions.append(*v);
    for (auto v = same.first; v != priorEnd; ++v)
        if (!current.contains(*v)) deletions.append(*v);
    return Dictionary{{"additions", additions}, {"deletions", deletions}};
}

} // namespace rolvane
