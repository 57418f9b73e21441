#include "server/mod_davacl/SyncRequest.h"

#include "server/mod_davacl/XmlElements.h"

#include <charconv>

namespace rolvane::davacl {

bool readNumberOfResults(const apr_xml_elem* element, std::optional<uint64_t>& number) {
    if (!element) return true;
    const std::string text = textOf(element);
    uint64_t value = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
    if (error != std::errc() || end != text.data() + text.size() || value == 0) return false;
    number = value;
    return true;
}

std::optional<SyncRequest> parseSyncRequest(const apr_xml_elem* root, const char*& problem) {
    const apr_xml_elem* token = child(root, "sync-token");
    const apr_xml_elem* level = child(root, "sync-level");
    const std::string depth = textOf(level);
    SyncRequest request;
    problem = nullptr;
    if (!token)
        problem = "A sync-collection has a DAV:sync-token, which may be empty.";
    else if (level && depth != "1" && depth != "infinite")
        problem = "A DAV:sync-level is 1 or infinite.";
    else if (!readNumberOfResults(child(child(root, "limit"), "nresults"), request.limit))
        problem = "nresults is no number above 0.";
    if (problem) return std::nullopt;
    request.token = textOf(token);
    request.isDeep = depth == "infinite";
    return request;
}

} // namespace rolvane::davacl
