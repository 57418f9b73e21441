#pragma once

#include "foundation/Notification.h"
#include "foundation/RunLoop.h"

#include <functional>
#include <string>

namespace rolvane {

// Calls back from the run loop, a turn later, when another process may have saved: after the bus signal, and after a
// touch of the file beside the database that every saver touches when its transaction is done. A write to the
// database's log alone (the saver may have died before the touch, or is a tool that knows of none) calls back a little
// later. False alarms are normal. All on the loop's thread.
class ChangeWatcher {
public:
    ChangeWatcher(RunLoop& loop, DistributedNotifications* distributed, const std::string& databasePath,
                  std::function<void()> changed);
    ~ChangeWatcher();
    ChangeWatcher(const ChangeWatcher&) = delete;
    ChangeWatcher& operator=(const ChangeWatcher&) = delete;

    // What a saver does. Failing to is no error.
    static void touch(const std::string& databasePath);

private:
    void readEvents();
    void callSoon();
    void callLater();

    RunLoop& _loop;
    std::string _path, _name;
    std::function<void()> _changed;
    int _fd = -1;
    RunLoop::Handle _port, _soon, _later;
    ObservationHandle _signal;
};

} // namespace rolvane
