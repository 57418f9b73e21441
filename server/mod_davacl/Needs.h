#pragma once

#include "server/mod_davacl/Privileges.h"

#include <string_view>
#include <vector>

namespace rolvane::davacl {

// A privilege that a request must have, on the resource itself or on the collection that holds it.
struct Need {
    Privilege privilege = kRead;
    bool onParent = false;
    bool operator==(const Need&) const = default;
};

// What stands at the place that a request names. A server that cannot tell says nothing: more is asked for then.
enum class Standing { nothing, file, collection };

// RFC 3744 appendix B. A method that is not known needs everything.
std::vector<Need> needsOf(std::string_view method, Standing standing);
// The same for the place that a Destination header names.
std::vector<Need> needsOfDestination(std::string_view method, Standing standing);

// The privileges on every tree that a request needs whose scope takes in all trees: it names the base or a place above
// it. `deep`: its Depth is infinity, said or by default. 0: the trees are not concerned.
unsigned neededOfMembers(std::string_view method, bool deep);
// The same where such a place is the Destination of COPY or MOVE.
unsigned neededOfMembersReplaced();
// The rights that a request for a place in a tree needs to the places within it that have lists of their own: mod_dav
// does not ask for each member. What is left out of a listing, or goes with its collection, needs nothing.
unsigned neededWithin(std::string_view method, bool deep);

// Whether a method changes what is stored.
bool changesSomething(std::string_view method);

} // namespace rolvane::davacl
