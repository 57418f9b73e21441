#pragma once

#include "foundation/Date.h"
#include "foundation/Mutex.h"
#include "foundation/StrongString.h"

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <unordered_set>
#include <vector>

namespace rolvane {

// What a server says about the version of a file: in a listing, or with an answer.
struct FileVersion {
    EntityTag etag;                   // empty when the server gives none
    std::optional<Date> lastModified; // to the second
    uint64_t size = 0;
};

// Remembers, per URL, the version of each remote file that this client last read or wrote. A cache: a forgotten version
// costs a read. Bounded: past `capacity` URLs it forgets some. Weak and strong forms of one entity tag are one version.
// Any thread. The file is a log that is read with the first use; a save adds what has changed since the one before, and
// writes the whole anew where most of the file is out of date. A save that is not there to its end has not been.
//   file = "RVM4" seed:u64 save*   save = row* end   row = urlHash:u64 kind:u64 value:u64 digest:u64   kind 0:
//   forgotten end = identity:u64 4:u64 passes:u64 sum:u64   of the rows of the save and this one. Numbers as the
//   machine has them.
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

    bool remembers(std::string_view url); // some version of it
    // A mark of the version: equal marks, in processes with the same file too, are of one entity tag. 0 where there is
    // none, or no tag tells the version.
    uint64_t markOf(std::string_view url);

    // Forgets everything, unless it was saved for this database, in this state or an earlier one. So does the file,
    // even where nothing is asked and saved afterwards, as in a pass that does not reach the store.
    void belongTo(const Owner& owner);
    void save(const Owner& owner); // nothing when unchanged; a failure is logged
    void revert();                 // to what was saved last
    size_t count();
    // So often something has become known or was forgotten in this process, clock files left out.
    uint64_t changes();
    // The URLs of that since the count was so; nothing where they are many, or anything else may have changed.
    std::optional<std::vector<std::string>> changedSince(uint64_t changes);

private:
    enum class Kind : uint64_t { tag = 1, dated = 2, written = 3 };
    struct Entry {
        Kind kind;
        uint64_t value;
        uint64_t digest = 0; // of a written version: hash of the tag that would be its digest
        bool operator==(const Entry&) const = default;
    };
    void need() REQUIRES(_mutex); // the file is read
    void load() REQUIRES(_mutex);
    void takeRows(const std::string& text) REQUIRES(_mutex);
    void takeFormerRows(const std::string& text) REQUIRES(_mutex);
    void judge(const Owner& owner) REQUIRES(_mutex);
    void put(std::string_view url, Entry entry) REQUIRES(_mutex);
    void erase(std::string_view url) REQUIRES(_mutex);
    uint64_t hash(std::string_view text) const REQUIRES(_mutex);
    uint64_t tagHash(const EntityTag& tag) const REQUIRES(_mutex);
    std::string rows(bool all) const REQUIRES(_mutex);
    bool append(const std::string& rows) REQUIRES(_mutex);
    void replace(const std::string& rows) REQUIRES(_mutex);

    const std::string _path;
    const size_t _capacity;
    mutable Mutex _mutex;
    bool _isRead GUARDED_BY(_mutex) = false;
    bool _isForeign GUARDED_BY(_mutex) = false; // the file is of another database, or of a later state of this one
    uint64_t _seed GUARDED_BY(_mutex) = 0;
    Owner _owner GUARDED_BY(_mutex);                // as saved last
    std::optional<Owner> _judge GUARDED_BY(_mutex); // whose it has to be, before it is read
    std::unordered_map<uint64_t, Entry> _entries GUARDED_BY(_mutex);
    std::unordered_set<uint64_t> _unsaved GUARDED_BY(_mutex); // hashes of URLs
    void noteChange(std::string_view url) REQUIRES(_mutex);
    void noteChangeOfMany() REQUIRES(_mutex);

    static constexpr size_t kNamed = 256;
    uint64_t _changes GUARDED_BY(_mutex) = 0;
    std::vector<std::string> _named GUARDED_BY(_mutex); // URLs of the last changes, each at its number modulo kNamed
    uint64_t _namedFrom GUARDED_BY(_mutex) = 0;         // the changes up to this number have no names
    uint64_t _fileNumber GUARDED_BY(_mutex) = 0, _fileSize GUARDED_BY(_mutex) =
                                                     0; // of the file as it was read or written last; 0: of none
};

} // namespace rolvane
