#pragma once

#include "foundation/Mutex.h"
#include "foundation/Value.h"
#include "store/http/StoreSession.h"
#include "store/locks/LockTokens.h"
#include "store/reads/EarlyReads.h"
#include "store/reads/GroupCopies.h"
#include "store/reads/ReadAhead.h"
#include "store/reads/VersionMemory.h"

#include <functional>
#include <optional>
#include <string>
#include <unordered_set>
#include <vector>

namespace rolvane {

// Reads, writes and removes the files of a store, names in, HTTP status codes out (0: no believable answer).
// Resolves paths that are a group's state file and its directory at once, and makes the write that follows a read
// conditional. A conditional write that fails with 412 while the store holds just what was to be written has succeeded:
// its answer was lost and it was sent again. One that fails although the store holds the very version that it named has
// met a server that gets conditions wrong, or knows none: it goes out without, under the lock of the tree. Any thread.
class StoreFiles {
public:
    StoreFiles(StoreSession& session, LockTokens& tokens, VersionMemory& versions);

    struct Reading {
        int code = 0;
        std::optional<Dictionary> dictionary;
        bool isKnown = false;             // the version is the one that this client read or wrote last
        std::optional<Date> lastModified; // by the server's clock
        bool failed = false;              // what is there, or whether anything is, was not learnt
    };
    Reading read(const Url& name, bool securely);
    // The next write of this thread, if it is to that file, is refused where something lies there. Sends nothing.
    void expectAbsence(const Url& name, bool securely);
    // These are going to be read, in this order (see ReadAhead).
    void expectReads(const std::vector<Url>& names, bool securely);
    // These are, too, in an order that is told later (see EarlyReads).
    void expectSomeReads(const std::vector<Url>& names, bool securely);
    void expectNoReads();
    // A listing has shown that the group is a collection: its state is looked for inside first.
    void foundCollection(const Url& name);
    // The groups' dictionaries whose version is the one that this client knows; consulted by `read` during a snapshot.
    GroupCopies& copies() { return _copies; }
    // `repair` is called when a folder on the way to the file is missing; true: worth another try.
    int write(const Url& name, std::string text, bool securely, const std::function<bool()>& repair = {});
    int remove(const Url& name);
    std::optional<Date> modificationDate(const Url& name);

    // True when the collection is there afterwards. A file in its way is moved into it.
    bool makeCollection(const Url& name);

    static bool succeeded(int code) { return code >= 200 && code < 300 && code != 207; }
    // True for names that the store's own bookkeeping uses and listings hide.
    static bool isReservedName(std::string_view name);

private:
    enum class Found { dictionary, noDictionary, absent, perhapsCollection, failed };
    struct Fetched {
        Found found = Found::failed;
        int code = 0;
        std::optional<Dictionary> dictionary;
        FileVersion version;
        bool isHtml = false; // as its content type has it
        std::string reason;  // why it is no dictionary
    };
    Fetched fetch(const Url& url, bool mayBeCollection);
    Fetched fetchEither(const Url& url, Url& target);
    Fetched confirmed(const Fetched& once, const Url& target);
    void note(const Url& name, const Url& target, const Fetched& fetched);

    void keepWritten(const Url& name, const std::string& text);
    HttpResponse put(const Url& name, const Url& target, const std::shared_ptr<const std::string>& body,
                     std::vector<std::pair<std::string, std::string>> headers);
    struct FileCondition {
        bool isAbsent = false;
        EntityTag etag;
    };
    enum class Standing { written, asKnown, other }; // what was to be written, what the condition named, neither
    Standing standing(const Url& name, const Url& target, const std::string& text, const FileCondition& condition);
    void noteWritten(const Url& name, const HttpResponse& answer, const std::string& text);
    enum class Kind { absent, file, collection, unknown };
    Kind kindOf(const Url& url, EntityTag* tag = nullptr);
    bool moveIntoCollection(const Url& url, const EntityTag& tag); // `tag`: the file's; empty when the store gives none

    Url asKnown(const Url& url) const; // with a slash when it is known to be a collection
    bool knownCollection(const Url& url) const;
    void remember(const Url& url);
    void forget(const Url& url);

    StoreSession& _session;
    LockTokens& _tokens;
    VersionMemory& _versions;
    const ReadAhead::Start _startReading;
    EarlyReads _early;
    ReadAhead _ahead;
    GroupCopies _copies;
    const uint64_t _reader; // tells this object from every other one of the process
    mutable Mutex _mutex;
    std::unordered_set<std::string> _collections GUARDED_BY(_mutex); // endpoints known to be collections; a cache
};

} // namespace rolvane
