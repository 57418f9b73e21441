#pragma once

#include "foundation/StrongString.h"

#include <string>

namespace rolvane {

// A change that came to an end without being carried out.
struct Refusal {
    UserName user;          // whose data it was to change
    std::string why = {};   // empty where the right to make it is missing, else one of those below
    std::string group = {}; // the name of the group that is gone
};
inline constexpr const char* kRefusedByOwnStore = "ownStore";       // of the owner's own; it is tried again
inline constexpr const char* kRefusedForItsName = "name";           // a name of the published tree's own
inline constexpr const char* kRefusedAsGroupIsGone = "groupIsGone"; // somebody else has deleted it

} // namespace rolvane
