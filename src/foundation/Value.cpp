#include "foundation/Value.h"

#include <algorithm>
#include <atomic>
#include <charconv>
#include <cmath>
#include <fmt/format.h>
#include <unordered_map>

namespace rolvane {

namespace {

const Value kAbsent;
constexpr size_t kIndexFrom = 24; // below this a linear search is as fast as the index

struct StringHash {
    using is_transparent = void;
    size_t operator()(std::string_view s) const { return std::hash<std::string_view>{}(s); }
};

} // namespace

// `index` counts the string elements: built on first need, dropped after a write that it cannot follow. Readers on
// several threads may need it at once: each builds its own and the first one to finish is kept.
struct Array::Storage {
    using Index = std::unordered_map<std::string, size_t, StringHash, std::equal_to<>>;
    std::vector<Value> items;
    mutable std::atomic<Index*> index{nullptr};

    Storage() = default;
    Storage(const Storage&) = delete;
    Storage& operator=(const Storage&) = delete;
    ~Storage() { delete index.load(); }

    const Index& counted() const {
        if (const Index* built = index.load(std::memory_order_acquire)) return *built;
        auto fresh = std::make_unique<Index>(items.size());
        for (const Value& v : items)
            if (const std::string* s = v.stringIf()) ++(*fresh)[*s];
        Index* none = nullptr;
        if (index.compare_exchange_strong(none, fresh.get(), std::memory_order_acq_rel)) return *fresh.release();
        return *none;
    }
    void added(const Value& v) {
        Index* built = index.load();
        if (!built) return;
        if (const std::string* s = v.stringIf()) ++(*built)[*s];
    }
    void removed(const Value& v) {
        Index* built = index.load();
        const std::string* s = v.stringIf();
        if (!built || !s) return;
        if (auto it = built->find(*s); it != built->end() && --it->second == 0) built->erase(it);
    }
    void dropIndex() { delete index.exchange(nullptr); }
};

Array::Array() : _p(std::make_shared<Storage>()) {}
Array::Array(std::initializer_list<Value> values) : Array() {
    _p->items.assign(values);
}
Array::Array(std::vector<Value> values) : Array() {
    _p->items = std::move(values);
}

size_t Array::count() const {
    return _p->items.size();
}
std::vector<Value>::const_iterator Array::begin() const {
    return _p->items.begin();
}
std::vector<Value>::const_iterator Array::end() const {
    return _p->items.end();
}
void Array::reserve(size_t n) {
    _p->items.reserve(n);
}

const Value& Array::operator[](size_t i) const {
    if (i >= _p->items.size())
        throw CXException(kCXRangeException, fmt::format("index {} is beyond the end of an array of {}", i, count()));
    return _p->items[i];
}

void Array::append(Value v) {
    _p->added(v);
    _p->items.push_back(std::move(v));
}

void Array::appendAll(const Array& other) {
    const size_t n = other.count(); // other may be this very array
    _p->items.reserve(_p->items.size() + n);
    for (size_t i = 0; i < n; ++i) append(other._p->items[i]);
}

void Array::insert(size_t index, Value v) {
    if (index > count())
        throw CXException(kCXRangeException,
                          fmt::format("index {} is beyond the end of an array of {}", index, count()));
    _p->added(v);
    _p->items.insert(_p->items.begin() + static_cast<std::ptrdiff_t>(index), std::move(v));
}

void Array::replace(size_t index, Value v) {
    _p->removed((*this)[index]);
    _p->added(v);
    _p->items[index] = std::move(v);
}

void Array::removeAt(size_t index) {
    _p->removed((*this)[index]);
    _p->items.erase(_p->items.begin() + static_cast<std::ptrdiff_t>(index));
}

void Array::removeAll(const Value& v) {
    const Value wanted = v; // NOLINT(performance-unnecessary-copy-initialization): v may live inside this array
    if (!contains(wanted)) return;
    std::erase(_p->items, wanted);
    const std::string* s = wanted.stringIf();
    if (Storage::Index* built = _p->index.load(); built && s) built->erase(*s);
}

void Array::removeAllOf(const Array& others) {
    if (others.empty()) return;
    const Array gone = others.isSame(*this) ? others.mutableCopy() : others;
    const size_t before = count();
    std::erase_if(_p->items, [&](const Value& v) { return gone.contains(v); });
    if (count() != before) _p->dropIndex();
}

bool Array::contains(const Value& v) const {
    if (const std::string* s = v.stringIf()) return containsString(*s);
    return std::find(begin(), end(), v) != end();
}

bool Array::containsString(std::string_view s) const {
    if (count() >= kIndexFrom) {
        const auto& index = _p->counted();
        return index.find(s) != index.end();
    }
    return std::any_of(begin(), end(), [&](const Value& v) { return v.stringIf() && *v.stringIf() == s; });
}

std::optional<size_t> Array::indexOf(const Value& v) const {
    if (v.isString() && !contains(v)) return std::nullopt;
    const auto it = std::find(begin(), end(), v);
    if (it == end()) return std::nullopt;
    return static_cast<size_t>(it - begin());
}

Array Array::mutableCopy() const {
    return Array(_p->items);
}

bool operator==(const Array& a, const Array& b) {
    return a._p == b._p || a._p->items == b._p->items;
}

Dictionary::Dictionary() : _p(std::make_shared<Map>()) {}
Dictionary::Dictionary(std::initializer_list<DictionaryEntry> entries) : Dictionary() {
    for (const auto& [key, value] : entries) set(key, value);
}

bool Dictionary::isSame(const Dictionary& other) const {
    return _p == other._p;
}
size_t Dictionary::count() const {
    return _p->size();
}
Dictionary::const_iterator Dictionary::begin() const {
    return _p->begin();
}
Dictionary::const_iterator Dictionary::end() const {
    return _p->end();
}

const Value& Dictionary::operator[](std::string_view key) const {
    const auto it = _p->find(key);
    return it == _p->end() ? kAbsent : it->second;
}

bool Dictionary::contains(std::string_view key) const {
    return _p->find(key) != _p->end();
}

void Dictionary::set(std::string_view key, Value v) {
    if (v.isAbsent())
        throw CXException(kCXInvalidArgumentException,
                          fmt::format("an absent value cannot be stored in a dictionary (key \"{}\")", key));
    if (auto it = _p->find(key); it != _p->end())
        it->second = std::move(v);
    else
        _p->emplace(std::string(key), std::move(v));
}

bool Dictionary::setIfNew(std::string&& key, Value v) {
    if (v.isAbsent())
        throw CXException(kCXInvalidArgumentException,
                          fmt::format("an absent value cannot be stored in a dictionary (key \"{}\")", key));
    const size_t before = _p->size();
    _p->try_emplace(_p->end(), std::move(key), std::move(v)); // the hint makes ascending keys cheap
    return _p->size() != before;
}

void Dictionary::remove(std::string_view key) {
    if (auto it = _p->find(key); it != _p->end()) _p->erase(it);
}

void Dictionary::addEntriesFrom(const Dictionary& other) {
    if (other.isSame(*this)) return;
    for (const auto& [key, value] : other) set(key, value);
}

std::vector<std::string> Dictionary::allKeys() const {
    std::vector<std::string> keys;
    keys.reserve(count());
    for (const auto& entry : *_p) keys.push_back(entry.first);
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
    *copy._p = *_p;
    return copy;
}

bool operator==(const Dictionary& a, const Dictionary& b) {
    return a._p == b._p || *a._p == *b._p;
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
    const auto* s = std::get_if<std::shared_ptr<const std::string>>(&_v);
    return s ? s->get() : nullptr;
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
    const auto* b = std::get_if<std::shared_ptr<const Bytes>>(&_v);
    return b ? **b : empty;
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
        std::vector<Value> items;
        items.reserve(a->count());
        for (const Value& v : *a) items.push_back(v.deepMutableCopy());
        return Array(std::move(items));
    }
    if (const Dictionary* d = dictionaryIf()) {
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
    case ValueType::string: return a.string() == b.string();
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

Dictionary cxDifferencesBetweenArray(const Array& prior, const Array& current) {
    Array additions, deletions;
    for (const Value& v : current)
        if (!prior.contains(v)) additions.append(v);
    for (const Value& v : prior)
        if (!current.contains(v)) deletions.append(v);
    return Dictionary{{"additions", additions}, {"deletions", deletions}};
}

} // namespace rolvane
