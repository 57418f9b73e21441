#pragma once

#include "server/mod_davacl/Httpd.h"

#include <functional>
#include <optional>
#include <string>

namespace rolvane::davacl {

// RFC 6578 on the trees: of every collection below the base that mod_dav_fs serves. TreeJournal has what is told.
bool canSynchronize(request_rec* r, const dav_resource* collection);
// DAV:sync-token of the collection that the request names; nothing for others, and when it cannot be had. Good for
// either sync-level.
std::optional<std::string> syncTokenOf(request_rec* r, const dav_resource* collection);

// The answer to a REPORT sync-collection: its responses and DAV:sync-token, or why not. `respond` makes the response of
// a member that is there, as PROPFIND has it.
struct SyncAnswer {
    std::string text;
    dav_error* error = nullptr;
};
SyncAnswer synchronize(request_rec* r, const dav_resource* collection, const apr_xml_doc* doc,
                       const std::function<std::string(const dav_resource*)>& respond);

} // namespace rolvane::davacl
