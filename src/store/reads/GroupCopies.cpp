#include "store/reads/GroupCopies.h"

namespace rolvane {

void GroupCopies::keep(const std::string& name, const Dictionary& content) {
    Dictionary own = Value(content).deepMutableCopy().dictionary();
    const std::lock_guard guard(_mutex);
    if (_copies.size() >= kMostGroups && !_copies.contains(name)) _copies.erase(_copies.begin());
    _copies.insert_or_assign(name, std::move(own));
    _unchanged.erase(name);
}

void GroupCopies::forget(const std::string& name) {
    const std::lock_guard guard(_mutex);
    _copies.erase(name);
    _unchanged.erase(name);
}

void GroupCopies::beginSnapshot() {
    const std::lock_guard guard(_mutex);
    _unchanged.clear();
    _inSnapshot = true;
}

void GroupCopies::endSnapshot() {
    const std::lock_guard guard(_mutex);
    _unchanged.clear();
    _inSnapshot = false;
}

void GroupCopies::foundUnchanged(const std::string& name) {
    const std::lock_guard guard(_mutex);
    if (_inSnapshot) _unchanged.insert(name);
}

std::optional<Dictionary> GroupCopies::unchanged(const std::string& name) const {
    const std::lock_guard guard(_mutex);
    const auto copy = _copies.find(name);
    if (copy == _copies.end() || !_unchanged.contains(name)) return std::nullopt;
    return Value(copy->second).deepMutableCopy().dictionary();
}

} // namespace rolvane
