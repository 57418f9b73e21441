#pragma once

#include "foundation/Date.h"
#include "foundation/StrongString.h"

#include <cstdint>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>

namespace rolvane {

// What a server says about the version of a file: in a listing, or with an answer.
struct FileVersion {
    EntityTag etag;                   // empty when the server gives none
    std::optional<Date> lastModified; // to the second
    uint64_t size = 0;
};

// Remembers, per URL, the version of each remote file that this client last read or wrote. A cache: a forgotten version
// costs a read. Bounded: past `capacity` URLs it forgets some. Weak and strong forms of one entity tag are one version.
// Any thread.
//   file = "RVM3" owner:u64 passes:u64 seed:u64 (urlHash:u64 kind:u64 value:u64 digest:u64)*   as the machine has it
class VersionMemory {
public:
    // Whose memory it is: what was read counts for the database that has it. One of an earlier state, a backup that was
    // put back, lacks what was read since.
    struct Owner {
        uint64_t identity = 0; // of the database
        uint64_t passes = 0;   // that it has seen
    };
    // `path` empty: in memory only. A damaged or missing file is an empty memory.
    explicit VersionMemory(std::string path = {}, size_t capacity = 400000);

    void read(std::string_view url, const FileVersion& version);
    // After a write. Where the answer to it gave no entity tag, a tag in a later listing that is a SHA-1 digest of the
    // content (28 characters of base64) tells for certain whose version it is; for other tags, and without any, size
    // and the server's own date decide, give or take a second.
    void wrote(std::string_view url, const EntityTag& etag, std::optional<Date> serverDate, std::string_view content);
    void forget(std::string_view url);
    // True when the version in a listing is the one remembered.
    bool knows(std::string_view url, const FileVersion& version);

    bool remembers(std::string_view url) const; // some version of it

    // Forgets everything, unless it was saved for this database, in this state or an earlier one.
    void belongTo(const Owner& owner);
    void save(const Owner& owner); // nothing when unchanged; a failure is logged
    void revert();                 // to what was saved last
    size_t count() const;

private:
    enum class Kind : uint64_t { tag = 1, dated = 2, written = 3 };
    struct Entry {
        Kind kind;
        uint64_t value;
        uint64_t digest = 0; // of a written version: hash of the tag that would be its digest
    };
    uint64_t hash(std::string_view text) const;
    uint64_t tagHash(const EntityTag& tag) const;
    void put(std::string_view url, Entry entry);
    void load();

    const std::string _path;
    const size_t _capacity;
    mutable std::mutex _mutex; // guards the following
    uint64_t _seed;
    Owner _owner;
    std::unordered_map<uint64_t, Entry> _entries;
    bool _changed = false;
};

} // namespace rolvane
