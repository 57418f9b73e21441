#pragma once

#include "store/dav/Multistatus.h"
#include "store/http/StoreSession.h"
#include "store/reads/ListingMemory.h"

#include <optional>
#include <string>

namespace rolvane {

// Keeps what was listed of a tree in step with the store by its changes alone (RFC 6578): one request however large the
// tree is. Any thread.
class SyncedListing {
public:
    SyncedListing(StoreSession& session, ListingMemory& memory) : _session(session), _memory(memory) {}

    // The token of the tree as it is; "" when the store gives none. To be asked before the tree is listed.
    std::string tokenOf(const Url& tree);
    std::optional<HttpRequest> tokenQuestion(const Url& tree) const; // the request of that; none outside the account
    static std::string tokenIn(const HttpResponse& answer);
    HttpRequest question(const Url& tree) const; // what has changed since the token that is kept
    // From the answer to the question on, to its last page. True: the memory holds the tree as the store has it, for
    // all of its containers, by the tag ListingMemory::kSynced. False: it has to be listed, and nothing is kept of it.
    bool bringUpToDate(const Url& tree, HttpResponse first);

private:
    bool take(const Url& tree, const HttpResponse& answer, bool& isCut);
    struct Applied {
        bool isCut = false; // another page follows
        // Besides the clock file: contact files with another version, where all else is as it was.
        ListingMemory::Files files = std::vector<std::string>();
    };
    std::optional<Applied> apply(const Url& tree, const std::vector<MultistatusEntry>& changes);

    StoreSession& _session;
    ListingMemory& _memory;
};

} // namespace rolvane
