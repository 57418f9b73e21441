#pragma once

#include "store/dav/Multistatus.h"
#include "store/files/CXFileManager.h"
#include "store/http/StoreSession.h"
#include "store/reads/ListingMemory.h"
#include "store/reads/VersionMemory.h"

#include <memory>
#include <optional>
#include <vector>

namespace rolvane {

// Lists containers of a store, one PROPFIND of depth 1 a collection, in parallel. Of a tree that was listed before it
// asks for the changes alone (SyncedListing) where the store tells them, and else lists only the buckets whose tag says
// that they have changed. Complete or nothing. Any thread.
class StoreListing {
public:
    StoreListing(StoreSession& session, VersionMemory& versions, ListingMemory& listings)
        : _session(session), _versions(versions), _listings(listings) {}

    // How much later than the listing a version is dated that this client has neither read nor written: whoever
    // compares with the date of the last sync leaves a margin, and the version must lie behind that in this very
    // listing.
    static constexpr double kUnseenSeconds = 5;

    // Containers that the store was asked to list, with the answers as they come.
    struct Asked;
    using AskedRef = std::shared_ptr<Asked>;
    // Asks the first questions of `list`. Does not wait. Whether the store tells changes may not be known yet: then the
    // token is asked for first, since a listing that was begun before it would have to be made again.
    AskedRef begin(const Url& container);
    // Asks what has changed in the tree since it was listed last, and remembers it. `begun` goes on from there, and is
    // then what `list` goes on from without asking again. False where that cannot be told.
    bool bringUpToDate(const Url& tree, AskedRef& begun);
    // As CXFileManager::infoForFilesInContainer; `begun`: goes on from there; `part`: as of
    // infoForFilesInContainerByParts.
    std::optional<FileListing> list(const Url& container, const AskedRef& begun = {},
                                    const CXFileManager::ListingPart& part = {});
    // Of a tree that was brought up to date, the entries of contact files that may be different from those of a listing
    // at an earlier moment, and of others. Nothing where anything else may be different, too.
    struct Since {
        uint64_t listing, versions;     // state of the memory of listings, count of changes of known versions
        const std::vector<Url>& others; // contacts whose entries are given in any case
    };
    std::optional<FileListing> contactsChangedSince(const Url& tree, const AskedRef& begun, const Since& since);
    // The names of the direct members of each container, with what they are. Nothing for a container that cannot be
    // listed; `codes` tells why.
    struct Members {
        int code = 0;
        std::optional<std::vector<std::pair<Url, MultistatusEntry>>> entries; // by name; the container itself left out
        std::optional<Date> serverDate;
    };
    std::vector<Members> members(const std::vector<Url>& containers);

private:
    // `tagged`: of that one's members the tags are asked for, too.
    AskedRef ask(const std::vector<Url>& containers, const Url* tagged = nullptr);
    Members read(Asked& asked, size_t number); // of an answer that has come
    std::vector<Members> readAll(Asked& asked);
    bool isEmptyCollection(const Url& place);
    enum class Keeping { nothing, tagged, synced };
    AskedRef askForAll(const Url& container, bool tagged);
    AskedRef askForChanges(const Url& tree);
    AskedRef askForToken(const Url& tree);
    std::string tokenOf(const Url& tree, const AskedRef& begun);
    std::optional<FileListing> listChanged(const Url& tree, AskedRef begun);
    bool addBuckets(const Members& people, Keeping keeping, FileListing& out, const CXFileManager::ListingPart& part);
    bool addUnchanged(const Url& container, const std::string& tag, const std::optional<Date>& serverDate,
                      FileListing& out);
    bool addEntries(const Members& members, FileListing& out, std::vector<Url>& groupCollections);
    bool addStates(const std::vector<Url>& groups, bool synced, FileListing& out);
    void stamp(std::string_view name, const MultistatusEntry& entry, const std::optional<Date>& serverDate,
               FileInfo& info);

    StoreSession& _session;
    VersionMemory& _versions;
    ListingMemory& _listings;
};

} // namespace rolvane
