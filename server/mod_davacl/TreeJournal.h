#pragma once

#include "server/mod_davacl/MembersTag.h"
#include "server/mod_davacl/SyncToken.h"

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane::davacl {

// The changes in an owner's tree, told by comparison of the disk with what was noted of it before. The disk is the
// truth: whoever changes something, mod_dav, a killed process or root's editor, is seen by the next look. A look costs
// a `stat` a member; of a directory whose sums are as they were nothing is read nor written.
//
// Each note has a number that is greater than all before it: microseconds since 1970, or one more than the last. So
// after a power cut, which may take the last notes away, no number is given twice. What changes within one step of the
// file system's clock may look unchanged; so what changed shortly before a look (`settle`) is told again by
// the next one.
//
// One directory for an owner: `head` (magic, epoch, last number, sum), which is the lock, too, and a DirectoryIndex for
// each collection that was looked at, in directories called by the hashes of their names. Losing any of it costs
// clients a synchronisation from the beginning. Any number of processes; no exception of its own.
class TreeJournal {
public:
    explicit TreeJournal(std::string directory) : _directory(std::move(directory)) {}

    // Departures that are remembered of one collection.
    static constexpr size_t kMostDepartures = 2000;

    static constexpr int64_t kSettle = static_cast<int64_t>(kSettleSeconds * 1e9);

    struct Question {
        std::string path;               // of the collection on the disk
        std::vector<std::string> below; // its place below the owner
        bool isDeep = false;            // what is below its members, too
        uint64_t scope = 0;             // of the token
        // Whether the reader may see the place below the owner; of one that may not be seen nothing is told.
        std::function<bool(const std::vector<std::string>&)> shows;
        std::optional<SyncToken> from; // nothing: everything that is there
        bool wantsChanges = true;      // else the token alone
        size_t limit = 0;              // at least 1
        int64_t now = 0;               // nanoseconds since 1970
        int64_t settle = kSettle;      // nanoseconds; longer than a step of the file system's clock
    };
    struct Change {
        std::string path; // below the collection
        bool isGone = false, isCollection = false;
    };
    enum class Outcome { told, invalidToken, linked, unreadable, unwritable };
    struct Answer {
        Outcome outcome = Outcome::unreadable;
        std::vector<Change> changes; // the earliest first
        SyncToken token;
        int error = 0; // errno
    };
    // With `linked` a directory below is a symbolic link: what it leads to has no place of its own.
    Answer changes(const Question& question) const;

private:
    std::string _directory;
};

} // namespace rolvane::davacl
