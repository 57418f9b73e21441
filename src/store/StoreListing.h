#pragma once

#include "store/CXFileManager.h"
#include "store/Multistatus.h"
#include "store/StoreSession.h"
#include "store/VersionMemory.h"

#include <optional>
#include <vector>

namespace rolvane {

// Lists containers of a store, one PROPFIND of depth 1 a collection, in parallel. Complete or nothing. Any thread.
class StoreListing {
public:
    StoreListing(StoreSession& session, VersionMemory& versions) : _session(session), _versions(versions) {}

    // How much later than the listing a version is dated that this client has neither read nor written: whoever
    // compares with the date of the last sync leaves a margin, and the version must lie behind that in this very
    // listing.
    static constexpr double kUnseenSeconds = 5;

    // As CXFileManager::infoForFilesInContainer.
    std::optional<FileListing> list(const Url& container);
    // The names of the direct members of each container, with what they are. Nothing for a container that cannot be
    // listed; `codes` tells why.
    struct Members {
        int code = 0;
        std::optional<std::vector<std::pair<Url, MultistatusEntry>>> entries; // by name; the container itself left out
        std::optional<Date> serverDate;
    };
    std::vector<Members> members(const std::vector<Url>& containers);

private:
    bool addEntries(const Members& members, FileListing& out, std::vector<Url>& groupCollections);
    bool addStates(const std::vector<Url>& groups, FileListing& out);
    void stamp(const Url& name, const MultistatusEntry& entry, const std::optional<Date>& serverDate, FileInfo& info);

    StoreSession& _session;
    VersionMemory& _versions;
};

} // namespace rolvane
