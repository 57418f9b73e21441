#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace rolvane::davacl {

// The state of a directory's direct members as it was noted last, with the number of the last change of each. Numbers
// grow over the whole journal (see TreeJournal). A file of its own, replaced at once; not synced: one that a power cut
// has spoilt says so by its sum.
//   file = head (magic, sums, count, since, last, records:u64, length:u64, sum of the records, sum of the head) record*
//   record = signature:u64 identity:u64 number:i64 appeared:i64 kind:u8 nameLength:u16 name       as the machine has it
struct DirectoryIndex {
    enum class Kind : uint8_t { gone, file, collection };
    struct Record {
        std::string name;
        Kind kind = Kind::gone;
        uint64_t signature = 0; // of name, kind, inode, size and times
        uint64_t identity = 0;  // of kind and inode
        int64_t number = 0;     // of the last change
        int64_t appeared = 0;   // when it came, or another one took its place; of a collection
    };
    struct Head {
        uint64_t sums[2] = {0, 0}; // of the signatures of present members, in two lanes
        uint64_t count = 0;        // of present members
        int64_t since = 0;         // departures up to this number have been forgotten
        int64_t last = 0;          // the highest number in it
    };
    Head head;
    std::vector<Record> records; // by name

    enum class State { absent, damaged, whole };
    static State readHead(const std::string& path, Head& head);
    static State read(const std::string& path, DirectoryIndex& index);
    bool write(const std::string& path) const; // false: errno says why
};

} // namespace rolvane::davacl
