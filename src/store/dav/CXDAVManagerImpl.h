#pragma once

#include "foundation/Mutex.h"
#include "store/dav/CXDAVManager.h"
#include "store/dav/StoreAccessLists.h"
#include "store/files/PublishStructure.h"
#include "store/files/StoreFiles.h"
#include "store/files/StoreListing.h"
#include "store/http/StoreSession.h"
#include "store/locks/LockTokens.h"
#include "store/reads/CacheFile.h"
#include "store/reads/VersionMemory.h"

#include <atomic>
#include <map>
#include <set>
#include <string>

namespace rolvane {

// What a client is made of, in the order in which its parts need one another.
struct CXDAVManager::Impl {
    Impl(CXDAVAccount account, std::shared_ptr<HttpTransport> transport, CurlTransport* signsIn,
         std::string versionsPath);

    LockTokens tokens;
    VersionMemory versions;
    StoreSession session;
    StoreFiles files;
    PublishStructure structure;
    StoreAccessLists accessLists;
    const std::string ownTree; // what every name below the account's own tree begins with

    // The listings and the copies of groups, of former processes too. Any thread.
    ListingMemory& listings();
    GroupCopies& copies();
    void saveListings(bool atEnd);
    std::atomic<bool> isOfDaemon = false; // what it remembers of the store is worth keeping
    const CacheFile groupFile;

    // Reads a dictionary. That a tree's "info" is forbidden or absent, which ends a publication or a subscription, is
    // told only when the store says it twice; in between it shows that it is a WebDAV server, and its owner's client
    // looks after the tree's structure.
    StoreFiles::Reading read(const Url& name, bool securely);

    Mutex begunLock;
    std::map<std::string, StoreListing::AskedRef> begunListings GUARDED_BY(begunLock); // by container
    StoreListing::AskedRef begun(const Url& container); // hands it out; null when there is none

    // The trees that were looked at in this process.
    void sawTree(const Url& tree);
    void forgetOtherTrees(); // copies of groups

private:
    Mutex _treesLock;
    std::set<std::string> _trees GUARDED_BY(_treesLock); // each with its "/"
    ListingMemory _listings;
    const CacheFile _listingFile;
    std::once_flag _listingsRead, _copiesRead;
};

} // namespace rolvane
