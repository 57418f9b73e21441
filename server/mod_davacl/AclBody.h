#pragma once

#include "server/mod_davacl/AccessLists.h"

#include <apr_xml.h>

#include <cstddef>
#include <functional>
#include <optional>
#include <string>
#include <vector>

namespace rolvane::davacl {

// Why a list is not taken.
struct Unmet {
    const char* precondition = nullptr; // of RFC 3744 section 8.1.1; null: the body is malformed
    std::string words;
};

// The place whose list the body sets, and the names that the body may use there.
struct AclPlace {
    std::string owner;
    std::vector<std::string> above; // the escaped URL paths of the places above that may have lists
    size_t mostEntries = 0;
    // Whom a reference names; nothing when that is nobody whom the server knows. May be asked once for each entry.
    std::function<std::optional<Principal>(const std::string& href)> principalAt;
};

// The list that the body of an ACL request asks for (section 8.1): without the owner's entry, and without those that
// were only sent back. The document may be null.
std::optional<Unmet> readAclBody(const apr_xml_doc* doc, const AclPlace& place, AccessList& list);

} // namespace rolvane::davacl
