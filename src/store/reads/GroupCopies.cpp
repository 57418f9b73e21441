#include "store/reads/GroupCopies.h"

#include "foundation/CXException.h"
#include "foundation/Mutex.h"
#include "store/reads/CacheText.h"

#include <utility>

namespace rolvane {

void GroupCopies::keep(const std::string& name, const Dictionary& content) {
    Dictionary own = Value(content).deepMutableCopy().dictionary();
    const Lock guard(_mutex);
    if (_copies.size() >= kMostGroups && !_copies.contains(name)) _copies.erase(_copies.begin());
    _copies.insert_or_assign(name, std::move(own));
    _former.erase(name);
    _hasChanged = true;
    _unchanged.erase(name);
}

void GroupCopies::forget(const std::string& name) {
    const Lock guard(_mutex);
    _hasChanged = _copies.erase(name) + _former.erase(name) > 0 || _hasChanged;
    _unchanged.erase(name);
}

void GroupCopies::forgetAll() {
    const Lock guard(_mutex);
    _copies.clear();
    _former.clear();
    _unchanged.clear();
    _hasChanged = true;
}

void GroupCopies::keepOnly(const std::set<std::string>& trees) {
    const auto isOfAnother = [&](const auto& copy) {
        return !trees.contains(copy.first.substr(0, copy.first.rfind('/') + 1));
    };
    const Lock guard(_mutex);
    _hasChanged = std::erase_if(_copies, isOfAnother) + std::erase_if(_former, isOfAnother) > 0 || _hasChanged;
}

void GroupCopies::beginSnapshot() {
    const Lock guard(_mutex);
    _unchanged.clear();
    _inSnapshot = true;
}

void GroupCopies::endSnapshot() {
    const Lock guard(_mutex);
    _unchanged.clear();
    _inSnapshot = false;
}

void GroupCopies::foundUnchanged(const std::string& name, uint64_t version) {
    const Lock guard(_mutex);
    if (!_inSnapshot) return;
    if (!_former.empty()) takeFormer(name, version);
    _unchanged.insert(name);
}

void GroupCopies::takeFormer(const std::string& name, uint64_t version) {
    const auto found = _former.find(name);
    if (found == _former.end()) return;
    const Former former = found->second;
    _former.erase(found);
    if (former.version == 0 || former.version != version || _copies.contains(name)) return;
    try {
        const auto* bytes = reinterpret_cast<const uint8_t*>(_formerText.data()) + former.at;
        const Value content = BinaryValue::decode(bytes, former.size);
        if (const Dictionary* copy = content.dictionaryIf()) _copies.insert_or_assign(name, *copy);
    } catch (const CXException&) { // it is read from the store
    }
    if (_former.empty()) std::exchange(_formerText, {});
}

std::optional<Dictionary> GroupCopies::unchanged(const std::string& name) const {
    const Lock guard(_mutex);
    const auto copy = _copies.find(name);
    if (copy == _copies.end() || !_unchanged.contains(name)) return std::nullopt;
    return Value(copy->second).deepMutableCopy().dictionary();
}

std::string GroupCopies::saved(const VersionOf& versionOf) const {
    const Lock guard(_mutex);
    std::string out;
    const auto add = [&](const std::string& name, uint64_t version, std::string_view content) {
        cacheAppend(out, std::string_view(name));
        cacheAppend(out, version);
        cacheAppend(out, content);
    };
    for (const auto& [name, content] : _copies)
        if (const uint64_t version = versionOf(name)) {
            const Bytes bytes = BinaryValue::encode(content);
            add(name, version, {reinterpret_cast<const char*>(bytes.data()), bytes.size()});
        }
    for (const auto& [name, former] : _former)
        if (former.version != 0 && versionOf(name) == former.version)
            add(name, former.version, std::string_view(_formerText).substr(former.at, former.size));
    return out;
}

void GroupCopies::restore(std::string text) {
    const Lock guard(_mutex);
    _formerText = std::move(text);
    for (CacheReader in(_formerText); !in.atEnd();) {
        const std::string name(in.text());
        const uint64_t version = in.number();
        const std::string_view content = in.text();
        if (!in.isWhole()) return _former.clear();
        if (_former.size() < kMostGroups && !_copies.contains(name))
            _former[name] = {version, static_cast<size_t>(content.data() - _formerText.data()), content.size()};
    }
}

bool GroupCopies::hasChanged() const {
    const Lock guard(_mutex);
    return _hasChanged;
}

} // namespace rolvane
