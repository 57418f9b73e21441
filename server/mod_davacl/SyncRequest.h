#pragma once

#include <apr_xml.h>

#include <cstdint>
#include <optional>
#include <string>

namespace rolvane::davacl {

// The body of a REPORT sync-collection (RFC 6578 section 6.1).
struct SyncRequest {
    std::string token; // "" at first
    bool isDeep = false;
    std::optional<uint64_t> limit;
};
// Nothing for a body that the RFC does not allow; `problem` then tells why. A missing level counts as 1.
std::optional<SyncRequest> parseSyncRequest(const apr_xml_elem* root, const char*& problem);
// False when the element is there and is no whole number above 0 (RFC 5323 section 5.17).
bool readNumberOfResults(const apr_xml_elem* element, std::optional<uint64_t>& number);

} // namespace rolvane::davacl
