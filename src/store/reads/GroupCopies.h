#pragma once

#include "foundation/BinaryValue.h"
#include "foundation/Mutex.h"
#include "foundation/Value.h"

#include <cstddef>
#include <functional>
#include <optional>
#include <set>
#include <string>
#include <unordered_map>
#include <unordered_set>

namespace rolvane {

// The dictionaries of group files as this client last read or wrote them, for the time of a snapshot: a file whose
// version in the fresh listing is still that one need not be fetched. Holds no version itself: an entry is always of
// the version that the VersionMemory has for the name, so both change together. Bounded. Any thread.
class GroupCopies {
public:
    static constexpr size_t kMostGroups = 10000;

    void keep(const std::string& name, const Dictionary& content);
    void forget(const std::string& name);
    void forgetAll();
    // Those of other trees than these (each with its "/") go. They were read once, and nobody asks for them any more.
    void keepOnly(const std::set<std::string>& trees);

    // A snapshot begins and ends; what was found unchanged counts only in between.
    void beginSnapshot();
    void endSnapshot();
    // By a listing. `version`: the mark that the VersionMemory has for the name.
    void foundUnchanged(const std::string& name, uint64_t version);
    // A copy that is the caller's own; nothing outside of a snapshot, or when the file may have changed.
    std::optional<Dictionary> unchanged(const std::string& name) const;

    // For a file (CacheFile.h): each with the mark of its version, so that one of another version counts for nothing.
    //   text = copy*   copy = name version:u64 content   name, content = size:u64 bytes
    using VersionOf = std::function<uint64_t(const std::string& name)>; // 0: none that is sure
    std::string saved(const VersionOf& versionOf) const;
    void restore(std::string text); // from then on `foundUnchanged` finds them
    bool hasChanged() const;        // since it was restored

private:
    struct Former {
        uint64_t version;
        size_t at, size; // of the content in _formerText
    };
    void takeFormer(const std::string& name, uint64_t version) REQUIRES(_mutex);

    mutable Mutex _mutex;
    std::unordered_map<std::string, Dictionary> _copies GUARDED_BY(_mutex);
    std::unordered_set<std::string> _unchanged GUARDED_BY(_mutex);
    bool _inSnapshot GUARDED_BY(_mutex) = false;
    std::string _formerText GUARDED_BY(_mutex);
    std::unordered_map<std::string, Former> _former GUARDED_BY(_mutex); // not decoded yet
    bool _hasChanged GUARDED_BY(_mutex) = false;
};

} // namespace rolvane
