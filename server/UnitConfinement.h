#pragma once

#include <string>
#include <vector>

namespace rolvane {

// Lines of a unit's [Service] that confine its program as packaging/systemd/RolvaneManager.service.in does, which says
// why each stands there. Only the places can be written; a missing one is no error. A place is a path, or begins with a
// specifier of systemd ("%h", "%t").
std::string unitConfinement(const std::vector<std::string>& writtenPlaces);

} // namespace rolvane
