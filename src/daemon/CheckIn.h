#pragma once

#include "foundation/RunLoop.h"

#include <memory>
#include <vector>

namespace rolvane {

// What the service launcher handed over: sources on the run loop that keep it waiting, and drain what arrives.
// Ends with its destruction.
class CheckInPorts {
public:
    CheckInPorts() = default;
    ~CheckInPorts();
    CheckInPorts(CheckInPorts&& other) noexcept;
    CheckInPorts& operator=(CheckInPorts&&) = delete;

    bool fromLauncher() const { return _fromLauncher; }

private:
    friend CheckInPorts CXDCheckIn(RunLoop& loop);
    std::vector<std::shared_ptr<RunLoop::Handle>> _sources; // an empty one: its peer has gone
    int _idle = -1;
    bool _fromLauncher = false;
};

// Checks in with the service launcher (sd_listen_fds) and schedules each socket that it passed as a source of the loop.
// A descriptor that is not this user's own is left as it is: one of the network, an abstract name, a path or a FIFO of
// somebody else's. Only programs of this user are listened to.
// Started without a launcher, or handed nothing usable, the process gets an idle source of its own, so that the loop
// waits all the same. Failures are silent.
CheckInPorts CXDCheckIn(RunLoop& loop);

} // namespace rolvane
