#pragma once

namespace rolvane {

// Clears away what killed processes of this user have left: temporary files, and the sockets on which earlier versions
// waited for the daemon to be ready. Called by the daemon when it starts. What belongs to a living process stays, and a
// failure is no error.
void removeLeftovers();

} // namespace rolvane
