#pragma once

#include "foundation/Mutex.h"
#include "store/dav/Multistatus.h"

#include "foundation/Url.h"

#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <vector>

namespace rolvane {

// The members of collections as the store listed them last, each with the tag that it gave for the state of the
// collection's members before that listing: a collection that still has the tag need not be listed again. Bounded: past
// kMostBytes it forgets everything. Any thread.
class ListingMemory {
public:
    using Entries = std::vector<std::pair<Url, MultistatusEntry>>; // direct members of the container
    static constexpr size_t kMostBytes = 64u << 20;

    // Replaces what was kept of the container. Without a tag nothing is kept.
    void keep(const Url& container, const std::string& tag, const Entries& entries);

    void forgetAll();
    void forgetBelow(const Url& container); // the container, whatever lies below it, and its token
    // Takes over what another memory has of a tree, which has a token there. Nothing where this one has a token for it.
    void takeOver(const Url& tree, ListingMemory&& from);

    // Up to where the containers of a tree are known (RFC 6578): those that are kept with the tag kSynced are as the
    // token says. Goes with anything of the memory.
    static constexpr const char* kSynced = "synced";
    // `files`: the URLs of files that have another version than when the token before it was kept, where nothing else
    // is different; nothing: anything may be.
    using Files = std::optional<std::vector<std::string>>;
    void keepToken(const Url& tree, const std::string& token, const Files& files = std::nullopt);
    std::string token(const Url& tree) const; // "" when there is none
    uint64_t stateOf(const Url& tree) const;  // another number for another state, in this process; 0 without a token
    // The files that may have another version than in that state of the tree; nothing: something else may be different,
    // too, or they are too many.
    Files filesChangedSince(const Url& tree, uint64_t state) const;

    // For a file (CacheFile.h). A token and the containers below its tree stay true together, however old they are. So
    // they are worth saving when a tree has come, when a tenth of all members has changed, and when the process ends
    // behind a change, or while there are trees that nobody asks for any more.
    void noteChanges(size_t members); // since they were saved
    bool isWorthSaving(bool atEnd) const;
    void wasSaved();
    // The trees that have got a token in this process, each with its containers. Numbers as the machine has them.
    //   text = tree*   tree = address token count:u64 container*   container = address text count:u64 row*
    //   address, token, text = size:u64 bytes
    std::string saved() const;
    // Takes over what `saved` gave. False where the text is damaged; nothing is taken over then.
    bool restore(std::string_view text);
    bool has(const Url& container, const std::string& tag) const;
    // Members of a container that is kept, by their names as they are written in URLs: an entry that is to be there, or
    // nothing for one that is gone. Each is told with the entry before. False, and nothing told, without the container.
    using Edits = std::map<std::string, std::optional<MultistatusEntry>, std::less<>>;
    using Told = std::function<void(const std::string& encodedName, const std::optional<MultistatusEntry>& before,
                                    const std::optional<MultistatusEntry>& now)>;
    bool edit(const Url& container, const std::string& tag, const Edits& edits, const Told& told);
    std::optional<MultistatusEntry> member(const Url& container, const std::string& tag,
                                           std::string_view encodedName) const;
    // The members, named below the container; nothing when it is not kept with this tag.
    std::optional<Entries> entries(const Url& container, const std::string& tag) const;

    struct Member {
        std::string_view encodedName; // the last component of the URL, as written
        MultistatusEntry entry;       // without href and status
    };
    // Calls back for each member, in the order of the listing, if the container still has the tag; false if not. The
    // name lives for the time of the call.
    template <class Take>
    bool forEach(const Url& container, const std::string& tag, Take take) const {
        const Lock guard(_mutex);
        const auto found = _containers.find(container.absoluteString());
        if (tag.empty() || found == _containers.end() || found->second.tag != tag) return false;
        for (const Row& row : found->second.rows) take(unpacked(found->second, row));
        return true;
    }

private:
    struct Row {
        uint32_t at, nameLength, tagLength; // in the text: the name, then the entity tag
        bool isCollection, hasDate, hasLength;
        double modified; // seconds since 1970
        uint64_t length;
    };
    struct Container {
        std::string tag, text;
        std::vector<Row> rows;
        size_t unused = 0;           // bytes of the text that no row needs
        std::vector<uint32_t> order; // numbers of the rows by their names, or empty until somebody looks one up
        size_t bytes() const { return text.size() + rows.size() * (sizeof(Row) + sizeof(uint32_t)); }
    };
    static Member unpacked(const Container& container, const Row& row);
    static std::string_view nameOf(const Container& container, const Row& row);
    static Row rowOf(std::string& text, std::string_view encodedName, const MultistatusEntry& entry);
    static Container packed(const Entries& entries);
    // Numbers of rows, until the rows change. Several only where a store lists a name twice.
    static std::span<const uint32_t> rowsNamed(Container& container, std::string_view encodedName);
    static void compact(Container& container);
    static void takeOut(Container& container, std::vector<size_t> places);
    size_t members() const REQUIRES(_mutex);

    mutable Mutex _mutex;
    mutable std::unordered_map<std::string, Container> _containers GUARDED_BY(_mutex); // their order comes late
    struct Synced {
        std::string token;
        uint64_t state = 0;
        bool isUsed = false;                                 // the store has given the token in this process
        std::vector<std::pair<uint64_t, std::string>> files; // of the states behind `filesFrom`, by state
        uint64_t filesFrom = 0;
    };
    static constexpr size_t kMostFiles = 256;
    std::unordered_map<std::string, Synced> _tokens GUARDED_BY(_mutex); // by tree
    uint64_t _lastState GUARDED_BY(_mutex) = 0;
    size_t _bytes GUARDED_BY(_mutex) = 0;
    size_t _changes GUARDED_BY(_mutex) = 0; // members that have changed since it was saved
    bool _isNew GUARDED_BY(_mutex) = false; // a tree has come that is in no file
};

} // namespace rolvane
