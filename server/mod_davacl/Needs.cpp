#include "server/mod_davacl/Needs.h"

#include <algorithm>
#include <iterator>

namespace rolvane::davacl {
namespace {

constexpr std::string_view kReaders[] = {"GET", "HEAD", "OPTIONS", "PROPFIND", "REPORT", "SEARCH"};
constexpr unsigned kAllBits[] = {
    kRead, kReadCurrentUserPrivilegeSet, kWriteContent, kWriteProperties, kBind, kUnbind, kReadAcl, kWriteAcl};

bool isReader(std::string_view method) {
    return std::find(std::begin(kReaders), std::end(kReaders), method) != std::end(kReaders);
}

} // namespace

std::vector<Need> needsOf(std::string_view method, Standing standing) {
    const bool there = standing != Standing::nothing;
    if (isReader(method)) return {{kRead, false}};
    if (method == "COPY") return {{kRead, false}};
    // What is moved away may be read where it arrives.
    if (method == "MOVE") return {{kRead, false}, {kUnbind, true}};
    if (method == "PUT" || method == "LOCK") return {there ? Need{kWriteContent, false} : Need{kBind, true}};
    if (method == "MKCOL") return {{kBind, true}};
    if (method == "DELETE") return {{kUnbind, true}};
    if (method == "PROPPATCH") return {{kWriteProperties, false}};
    // Whose lock it is, mod_dav checks: only the one who took it gives it back.
    if (method == "UNLOCK") return {{kWriteContent, false}};
    // httpd answers a POST to a file with the file.
    if (method == "POST" || method == "PATCH") return {{kRead, false}, {kWriteContent, false}};
    if (method == "ACL") return {{kWriteAcl, false}};
    std::vector<Need> everything;
    for (const unsigned bit : kAllBits) everything.push_back({static_cast<Privilege>(bit), false});
    return everything;
}

std::vector<Need> needsOfDestination(std::string_view method, Standing standing) {
    if (standing == Standing::nothing) return {{kBind, true}};
    if (method == "COPY" && standing == Standing::file) return {{kWriteContent, false}, {kWriteProperties, false}};
    // What is there is removed before.
    return {{kUnbind, true}, {kBind, true}};
}

unsigned neededOfMembers(std::string_view method, bool deep) {
    // These two are deep by themselves, whatever Depth says (RFC 4918 sections 9.6.1 and 9.9.2).
    if (method == "DELETE") return kUnbind;
    if (method == "MOVE") return kRead | kUnbind;
    if (!deep) return 0;
    if (method == "COPY" || method == "PROPFIND" || method == "REPORT") return kRead;
    if (method == "LOCK") return kWriteContent;
    return 0;
}

unsigned neededOfMembersReplaced() {
    return kUnbind | kBind;
}

unsigned neededWithin(std::string_view method, bool deep) {
    if (!deep) return 0;
    if (method == "COPY") return kRead;
    return method == "LOCK" ? unsigned{kWriteContent} : 0U;
}

bool changesSomething(std::string_view method) {
    return !isReader(method) && method != "UNLOCK" && method != "LOCK" && method != "ACL";
}

} // namespace rolvane::davacl
