#pragma once

#include "foundation/Date.h"
#include "foundation/StrongString.h"

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

// One `response` of a multistatus body (RFC 4918 section 14.24), with the properties that a listing asks for.
// Properties are taken from propstats of status 200 only, and from those that say no status.
struct MultistatusEntry {
    std::string href; // as the server wrote it, surrounding white space dropped
    int status = 0;   // the response's own status, 0 when it has propstats instead
    bool isCollection = false;
    std::optional<Date> lastModified; // of RFC 9110 section 5.6.7, or RFC 3339
    std::optional<uint64_t> length;
    EntityTag etag;
    std::string membersTag;     // of a collection, on a store that gives one (StoreSession::givesMembersTags)
    std::string syncToken = {}; // of a collection (RFC 6578 section 4), where it was asked for
};

struct MultistatusLimits {
    int maxDepth = 32;
    size_t maxEntries = 1000000;
    size_t maxText = 16384; // of one href or property
};

// Reads a multistatus body piece by piece (libxml2 SAX; no declarations or entities of the document's own, no network).
// What it has read counts only when `finish` says so: a truncated body is nothing. One thread.
class MultistatusReader {
public:
    explicit MultistatusReader(MultistatusLimits limits = {});
    ~MultistatusReader();

    bool feed(std::string_view bytes); // false once the body cannot be good any more; further calls do nothing
    // The entries in the server's order; nothing when the body is not one whole, well-formed multistatus.
    std::optional<std::vector<MultistatusEntry>> finish();
    // After that: what the whole answer says (RFC 6578 section 6.2), "" when it says none.
    const std::string& syncToken() const;

    struct Impl;

private:
    std::unique_ptr<Impl> _impl;
};

// The active lock that a LOCK answer grants (RFC 4918 section 9.10), or that a property lockdiscovery tells of.
struct LockGrant {
    LockToken token;                      // empty when the body names none
    std::string owner;                    // the text of what the client said of the owner
    std::optional<double> timeoutSeconds; // nothing: infinite or not said
};
// Of a LOCK answer; of several active locks, what the last one says. Nothing when the text is not one well-formed
// document, or tells of no active lock. At most 1 MiB is looked at.
std::optional<LockGrant> parseLockAnswer(std::string_view body);
// The same of a multistatus with the property lockdiscovery of one resource: every active lock, in the server's order.
std::optional<std::vector<LockGrant>> parseLockDiscovery(std::string_view body);

} // namespace rolvane
