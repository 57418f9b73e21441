#include "contacts/records/ContactMerge.h"

#include "contacts/records/CXMultiValue.h"
#include "contacts/records/Constants.h"
#include "foundation/PropertyList.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <set>
#include <string_view>

namespace rolvane {

namespace {

using Entries = std::vector<CXMultiValue::Entry>;
constexpr size_t kNone = SIZE_MAX;

// Single values that are one: the first name stands for all of them.
constexpr std::array kTogether{std::array<std::string_view, 2>{kCXPhotoProperty, kCXPhotoTypeProperty},
                               std::array<std::string_view, 2>{kCXBirthdayProperty, kCXBirthdayTextProperty}};

std::vector<std::string_view> valuesWith(std::string_view property) {
    for (const auto& names : kTogether)
        if (std::find(names.begin(), names.end(), property) != names.end()) return {names.begin(), names.end()};
    return {property};
}

bool isListOfStrings(const Value& value) {
    const Array* array = value.arrayIf();
    return array && std::all_of(array->begin(), array->end(), [](const Value& v) { return v.isString(); });
}

// True when none of the values is of another kind, and one of them is of this one.
template <class Test>
bool areAll(const Value& base, const Value& ours, const Value& theirs, Test is) {
    const auto fits = [&](const Value& v) { return v.isAbsent() || is(v); };
    return (is(ours) || is(theirs)) && fits(ours) && fits(theirs) && fits(base);
}

bool says(const CXMultiValue::Entry& a, const CXMultiValue::Entry& b) {
    return a.label == b.label && a.value == b.value;
}

// For each entry of `from` its counterpart in `in`: by identifier, else one that says the same. One to one.
std::vector<size_t> counterparts(const Entries& from, const Entries& in) {
    std::vector<size_t> found(from.size(), kNone);
    std::vector<bool> taken(in.size(), false);
    const auto claim = [&](auto fits) {
        for (size_t i = 0; i < from.size(); ++i)
            for (size_t j = 0; j < in.size() && found[i] == kNone; ++j)
                if (!taken[j] && fits(from[i], in[j])) {
                    found[i] = j;
                    taken[j] = true;
                }
    };
    claim([](const auto& a, const auto& b) { return a.identifier == b.identifier && says(a, b); });
    claim([](const auto& a, const auto& b) { return a.identifier == b.identifier; });
    claim([](const auto& a, const auto& b) { return says(a, b); });
    return found;
}

// An identifier for an entry whose own is taken: the same one on every side, whoever makes it.
std::string derivedIdentifier(const CXMultiValue::Entry& entry, int round) {
    const Bytes content = BinaryValue::encode(Value(Array{entry.identifier, entry.label, entry.value, round}));
    uint64_t high = 0xcbf29ce484222325u, low = 0x84222325cbf29ce4u;
    for (const auto byte : content) {
        high = (high ^ static_cast<uint8_t>(byte)) * 0x100000001b3u;
        low = (low ^ high) * 0x9e3779b97f4a7c15u;
    }
    std::array<char, 40> text{};
    std::snprintf(text.data(), text.size(), "%08X-%04X-%04X-%04X-%012llX", static_cast<unsigned>(high >> 32),
                  static_cast<unsigned>(high >> 16 & 0xffff), static_cast<unsigned>(high & 0xffff),
                  static_cast<unsigned>(low >> 48), static_cast<unsigned long long>(low & 0xffffffffffffu));
    return text.data();
}

class MultiValueMerge {
public:
    MultiValueMerge(Entries base, Entries ours, Entries theirs)
        : _base(std::move(base)), _ours(std::move(ours)), _theirs(std::move(theirs)),
          _oursOf(counterparts(_base, _ours)), _theirsOf(counterparts(_base, _theirs)) {}

    CXMultiValue result() {
        std::vector<bool> oursIsKnown(_ours.size(), false);
        std::vector<size_t> baseOfTheirs(_theirs.size(), kNone);
        for (size_t b = 0; b < _base.size(); ++b) {
            if (_oursOf[b] != kNone) oursIsKnown[_oursOf[b]] = true;
            if (_theirsOf[b] != kNone) baseOfTheirs[_theirsOf[b]] = b;
        }
        for (size_t t = 0; t < _theirs.size(); ++t) {
            if (baseOfTheirs[t] == kNone)
                _all.push_back(_theirs[t]);
            else
                addKnown(_theirs[t], baseOfTheirs[t]);
        }
        for (size_t b = 0; b < _base.size(); ++b) // what they have removed and we have changed
            if (_theirsOf[b] == kNone && _oursOf[b] != kNone && !says(_ours[_oursOf[b]], _base[b]))
                _wanted.push_back(_ours[_oursOf[b]]);
        for (size_t o = 0; o < _ours.size(); ++o)
            if (!oursIsKnown[o]) _wanted.push_back(_ours[o]);
        _all.insert(_all.end(), _wanted.begin(), _wanted.end());
        return numbered();
    }

private:
    // An entry of theirs that was there before.
    void addKnown(const CXMultiValue::Entry& theirs, size_t b) {
        const auto& base = _base[b];
        if (_oursOf[b] == kNone) {
            if (!says(theirs, base)) _all.push_back(theirs); // removed here, changed there
            return;
        }
        const auto& ours = _ours[_oursOf[b]];
        CXMultiValue::Entry both = theirs;
        if (theirs.label == base.label) both.label = ours.label;
        if (theirs.value == base.value) both.value = ours.value;
        const bool ourPartIsIn = (ours.label == base.label || ours.label == both.label) &&
                                 (ours.value == base.value || ours.value == both.value);
        _all.push_back(ourPartIsIn ? both : theirs);
        if (!ourPartIsIn) _wanted.push_back(ours);
    }

    // What is said twice is there once.
    CXMultiValue numbered() const {
        CXMutableMultiValue result;
        for (const auto& entry : _all) {
            const auto& there = result.entries();
            if (std::any_of(there.begin(), there.end(), [&](const auto& each) { return says(each, entry); })) continue;
            std::string identifier = entry.identifier;
            for (int round = 0; result.indexForIdentifier(identifier); ++round)
                identifier = derivedIdentifier(entry, round);
            result.addValue(entry.value.deepMutableCopy(), entry.label, identifier);
        }
        return result;
    }

    const Entries _base, _ours, _theirs;
    const std::vector<size_t> _oursOf, _theirsOf; // by place in the base
    Entries _all, _wanted;                        // of ours, to stand beside theirs
};

Entries entriesOf(const Value& value) {
    const auto multi = CXMultiValue::fromValue(value);
    return multi ? multi->entries() : Entries();
}

Value mergedMultiValue(const Value& base, const Value& ours, const Value& theirs) {
    const CXMultiValue result = MultiValueMerge(entriesOf(base), entriesOf(ours), entriesOf(theirs)).result();
    if (result.empty() && (ours.isAbsent() || theirs.isAbsent())) return {};
    return result.toValue();
}

Value mergedList(const Value& base, const Value& ours, const Value& theirs) {
    const Array before = base.array(), here = ours.array();
    Array result;
    for (const Value& text : theirs.array())
        if (!before.contains(text) || here.contains(text)) result.append(text);
    for (const Value& text : here)
        if (!before.contains(text) && !result.contains(text)) result.append(text);
    if (result.empty() && (ours.isAbsent() || theirs.isAbsent())) return {};
    return result;
}

Value sentMultiValue(const Value& base, const Value& sent, const Value& theirs) {
    const Entries before = entriesOf(base), ours = entriesOf(sent), there = entriesOf(theirs);
    const auto oursOf = counterparts(before, ours), theirsOf = counterparts(before, there);
    const auto sentOfTheirs = counterparts(there, ours);
    const auto cameAsSent = [&](size_t t) { return sentOfTheirs[t] != kNone && says(there[t], ours[sentOfTheirs[t]]); };
    CXMutableMultiValue result;
    const auto add = [&](const CXMultiValue::Entry& entry) {
        result.addValue(entry.value, entry.label, entry.identifier);
    };
    std::vector<bool> isOfBase(there.size(), false);
    for (size_t b = 0; b < before.size(); ++b) {
        const size_t t = theirsOf[b];
        if (t != kNone) isOfBase[t] = true;
        if (t == kNone && oursOf[b] == kNone) continue; // both have removed it
        add(t != kNone && cameAsSent(t) ? there[t] : before[b]);
    }
    for (size_t t = 0; t < there.size(); ++t)
        if (!isOfBase[t] && cameAsSent(t) && !result.indexForIdentifier(there[t].identifier)) add(there[t]);
    return result.toValue();
}

Value sentList(const Value& base, const Value& sent, const Value& theirs) {
    const Array before = base.array(), ours = sent.array(), there = theirs.array();
    Array result;
    for (const Value& text : before)
        if (ours.contains(text) || there.contains(text)) result.append(text);
    for (const Value& text : there)
        if (!before.contains(text) && ours.contains(text)) result.append(text);
    return result;
}

// An entry that was new in what was sent lies there, by the identifier that it was given here and whatever it says by
// now: a version is written whole, so all of it has come.
bool hasCome(const Dictionary& base, const Dictionary& sent, const Dictionary& theirs) {
    return std::any_of(sent.begin(), sent.end(), [&](const auto& property) {
        const auto& [name, value] = property;
        if (!CXMultiValue::isMultiValue(value) || !CXMultiValue::isMultiValue(theirs[name])) return false;
        const Entries before = entriesOf(base[name]), there = entriesOf(theirs[name]);
        for (const auto& entry : entriesOf(value)) {
            const auto isIn = [&](const Entries& entries) {
                return std::any_of(entries.begin(), entries.end(),
                                   [&](const auto& each) { return each.identifier == entry.identifier; });
            };
            if (!isIn(before) && isIn(there)) return true;
        }
        return false;
    });
}

class ContactMerging {
public:
    ContactMerging(const Dictionary& base, const Dictionary& ours, const Dictionary& theirs, CXSide later)
        : _base(base), _ours(ours), _theirs(theirs), _later(later) {}

    CXMergeResult result() {
        std::set<std::string> names;
        for (const Dictionary& side : {_ours, _theirs})
            for (const auto& [name, value] : side) names.insert(std::string(valuesWith(name).front()));
        for (const std::string& name : names)
            if (name != kCXRemoteLocationProperty) merge(name);
        return std::move(_result);
    }

private:
    void merge(const std::string& name) {
        const Value &base = _base[name], &ours = _ours[name], &theirs = _theirs[name];
        if (areAll(base, ours, theirs, [](const Value& v) { return CXMultiValue::isMultiValue(v); })) {
            if (const Value& same = theOnlyChange(base, ours, theirs))
                set(name, same);
            else if (ours != base || theirs != base) // else both have removed it
                set(name, mergedMultiValue(base, ours, theirs));
        } else if (areAll(base, ours, theirs, isListOfStrings)) {
            set(name, mergedList(base, ours, theirs));
        } else {
            mergeSingle(name);
        }
    }

    // Of two values of which at most one differs from the base; else absent.
    static Value theOnlyChange(const Value& base, const Value& ours, const Value& theirs) {
        if (ours == theirs || ours == base) return theirs;
        return theirs == base ? ours : Value();
    }

    void mergeSingle(const std::string& name) {
        const auto names = valuesWith(name);
        const Dictionary before = part(_base, names), ours = part(_ours, names), theirs = part(_theirs, names);
        if (ours == theirs || ours == before) return put(theirs);
        if (theirs == before) return put(ours);
        const bool oursIsKept = _later == CXSide::ours;
        put(oursIsKept ? ours : theirs);
        _result.conflicts.push_back({name, oursIsKept ? ours : theirs, oursIsKept ? theirs : ours, _later});
    }

    static Dictionary part(const Dictionary& all, const std::vector<std::string_view>& names) {
        Dictionary some;
        for (const std::string_view name : names)
            if (const Value& value = all[name]) some.set(name, value.deepMutableCopy());
        return some;
    }
    void put(const Dictionary& values) {
        for (const auto& [name, value] : values) set(name, value);
    }
    void set(std::string_view name, const Value& value) {
        if (!value.isAbsent()) _result.contact.set(name, value.deepMutableCopy());
    }

    const Dictionary &_base, &_ours, &_theirs;
    const CXSide _later;
    CXMergeResult _result;
};

} // namespace

CXMergeResult mergedContact(const std::optional<Dictionary>& base, const Dictionary& ours, const Dictionary& theirs,
                            CXSide later) {
    const Dictionary before = base.value_or(Dictionary());
    return ContactMerging(before, ours, theirs, later).result();
}

Dictionary cxBaseAfterSending(const Dictionary& base, const Dictionary& sent, const Dictionary& theirs) {
    if (hasCome(base, sent, theirs)) return sent;
    Dictionary result = base.mutableCopy();
    std::set<std::string> names;
    for (const Dictionary& side : {base, sent, theirs})
        for (const auto& [name, value] : side) names.insert(name);
    const auto areAllOf = [&](const std::string& name, auto is) {
        return areAll(base[name], sent[name], theirs[name], is) || areAll(sent[name], base[name], theirs[name], is);
    };
    for (const std::string& name : names) {
        Value both = base[name];
        if (sent[name] == theirs[name])
            both = theirs[name];
        else if (areAllOf(name, [](const Value& v) { return CXMultiValue::isMultiValue(v); }))
            both = sentMultiValue(base[name], sent[name], theirs[name]);
        else if (areAllOf(name, isListOfStrings))
            both = sentList(base[name], sent[name], theirs[name]);
        if (both)
            result.set(name, both);
        else
            result.remove(name);
    }
    return result;
}

void cxYieldWhatWasSent(CXMergeResult& merge, const Dictionary& sent) {
    for (CXMergeConflict& conflict : merge.conflicts) {
        const auto wasSent = [&](const auto& value) { return sent[value.first] == value.second; };
        if (conflict.winner == CXSide::theirs || conflict.kept.empty() ||
            !std::all_of(conflict.kept.begin(), conflict.kept.end(), wasSent))
            continue;
        for (const auto& [name, value] : conflict.kept) merge.contact.remove(name);
        for (const auto& [name, value] : conflict.lost) merge.contact.set(name, value.deepMutableCopy());
        std::swap(conflict.kept, conflict.lost);
        conflict.winner = CXSide::theirs;
    }
}

CXSide laterSide(const std::optional<Date>& ours, const std::optional<Date>& theirs, const Dictionary& ourContact,
                 const Dictionary& theirContact) {
    if (ours && theirs && *ours != *theirs) return *ours < *theirs ? CXSide::theirs : CXSide::ours;
    return BinaryValue::encode(ourContact) < BinaryValue::encode(theirContact) ? CXSide::theirs : CXSide::ours;
}

} // namespace rolvane
