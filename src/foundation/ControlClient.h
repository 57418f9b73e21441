#pragma once

#include "foundation/ControlMessage.h"
#include "foundation/ControlSocket.h"
#include "foundation/Mutex.h"
#include "foundation/RunLoop.h"

#include <functional>
#include <map>
#include <optional>

namespace rolvane {

// A command's end of the daemon's control socket. Looks for the daemon when it is to say something, and every moment
// while something is observed; a daemon that starts later, or anew, is found then. Nothing here waits for an answer.
// On the run loop's thread, but for `post`.
class ControlClient {
public:
    // Where the daemon that runs now listens; none while none runs.
    using Finder = std::function<std::optional<std::string>()>;
    ControlClient(RunLoop& loop, Finder find, std::function<void(Notification)> arrived);
    ~ControlClient();
    ControlClient(const ControlClient&) = delete;
    ControlClient& operator=(const ControlClient&) = delete;

    bool connect(); // true when there is a connection now
    bool connected() const;
    // What is to be heard of from now on, whenever there is a connection.
    void observe(std::vector<std::string> names);
    // Any thread. False when it could not be written, or there is no daemon.
    bool post(const Notification& notification);
    // As `post`, asking for an answer; or only whether somebody is there. The number to ask `heard` for; none when
    // nobody was reached.
    std::optional<int64_t> postForAnswer(const Notification& notification);
    std::optional<int64_t> ask();
    // The answer, when it has come: whether anybody acts on what was posted.
    std::optional<bool> heard(int64_t number) const;

private:
    bool connectLocked() REQUIRES(_mutex);
    bool send(ControlMessage message);
    std::optional<int64_t> sendForAnswer(ControlMessage message);
    void watchSoon();
    void read();
    void lost();
    void lookLater();

    RunLoop& _loop;
    const Finder _find;
    const std::function<void(Notification)> _arrived;
    mutable RecursiveMutex _mutex;
    OwnedDescriptor _socket GUARDED_BY(_mutex);
    std::vector<std::string> _names GUARDED_BY(_mutex);
    ControlReader _reader;
    std::map<int64_t, bool> _heard;
    int64_t _lastNumber = 0;
    RunLoop::Handle _port, _look;
};

} // namespace rolvane
