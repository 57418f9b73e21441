#pragma once

#include "foundation/Value.h"

#include <cstddef>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <unordered_set>

namespace rolvane {

// The dictionaries of group files as this client last read or wrote them, for the time of a snapshot: a file whose
// version in the fresh listing is still that one need not be fetched. Holds no version itself: an entry is always of
// the version that the VersionMemory has for the name, so both change together. In memory only, bounded. Any thread.
class GroupCopies {
public:
    static constexpr size_t kMostGroups = 10000;

    void keep(const std::string& name, const Dictionary& content);
    void forget(const std::string& name);

    // A snapshot begins and ends; what was found unchanged counts only in between.
    void beginSnapshot();
    void endSnapshot();
    void foundUnchanged(const std::string& name); // by a listing
    // A copy that is the caller's own; nothing outside of a snapshot, or when the file may have changed.
    std::optional<Dictionary> unchanged(const std::string& name) const;

private:
    mutable std::mutex _mutex; // guards the following
    std::unordered_map<std::string, Dictionary> _copies;
    std::unordered_set<std::string> _unchanged;
    bool _inSnapshot = false;
};

} // namespace rolvane
