#pragma once

#include "server/mod_davacl/Configuration.h"
#include "server/mod_davacl/ListStore.h"
#include "server/mod_davacl/Needs.h"
#include "server/mod_davacl/TreePath.h"

#include <map>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

namespace rolvane::davacl {

// A privilege that somebody lacks, and where.
struct Missing {
    TreePath place;
    Privilege privilege = kRead;
};

// What one request has learnt, kept until it ends: every list is read once, however many members a listing has. It
// belongs to the main request, which its sub-requests share.
struct RequestState {
    std::map<std::string, std::optional<OwnersLists>> lists; // by owner; nothing: damaged
    std::string grantedTo;                                   // the user of the next
    std::map<std::string, OwnersLists::Granted> granted;     // by owner
    std::map<std::pair<std::string, std::string>, std::string>
        entries; // of DAV:acl, by list and where it is shown from
    std::optional<std::set<std::string, std::less<>>> usersInFile;
    std::map<std::string, bool, std::less<>> knownUsers; // as the providers said
    std::optional<std::string> groupText;                // of the group file
    std::optional<Missing> destinationLacks;             // why the sub-request for a Destination was refused
    std::vector<ListStore::Guard> guards;
    std::map<const ap_conf_vector_t*, ap_conf_vector_t*> confined; // the sections' settings, and with ours on top

    void forgetLists() { // they are read anew
        lists.clear();
        granted.clear();
    }
};
RequestState& stateOf(request_rec* r);

const OwnersLists* listsOf(request_rec* r, const Configuration& c, const std::string& owner); // null: damaged
// What the request's user may do there. Nobody may do anything without a name.
unsigned privilegesOn(request_rec* r, const Configuration& c, const TreePath& place);
// The first of the needs that is not met.
std::optional<Missing> missingOf(request_rec* r, const Configuration& c, const TreePath& place,
                                 const std::vector<Need>& needs);
// The same for what a deep request takes in besides: a list within the place may deny what is granted there. The
// answer names the place itself, since whoever may not read a member need not know of it.
std::optional<Missing> missingWithin(request_rec* r, const Configuration& c, const TreePath& place);
Standing standingOf(const request_rec* r);
// Infinity is what LOCK, COPY, MOVE and PROPFIND mean when they say nothing; REPORT means 0 (RFC 3253 section 3.6).
bool isDeep(const request_rec* r);

// The path of a place as a URL has it.
std::string urlPathOf(request_rec* r, const Configuration& c, const TreePath& place);
// The same as a <D:href>.
std::string hrefOf(request_rec* r, const Configuration& c, const TreePath& place);
std::string hrefElement(request_rec* r, const std::string& path); // <D:href>, from a path that is not escaped

// Answers 403 with DAV:need-privileges (RFC 3744 section 7.1.1), or asks whoever is not signed in to do so. What a
// handler returns then.
int refuse(request_rec* r, const Configuration& c, const Missing& missing);
// The text of a file, nothing or "" when it cannot be read.
std::optional<std::string> readableText(const char* path);
std::string fileText(const char* path);

} // namespace rolvane::davacl
