#pragma once

#include "foundation/Notification.h"
#include "foundation/RunLoop.h"

#include <functional>
#include <string>

namespace rolvane {

// Calls back from the run loop, a turn later, when another process may have saved: after the bus signal, and after a
// touch of the file beside the database that every saver touches when its transaction is done. A write to the
// database's log alone (the saver may have died before the touch, or is a tool that knows of none) calls back a little
// later. False alarms are normal. Where the kernel gives no watch (fs.inotify.max_user_instances: each process of a
// user takes one), the log says so once, and the files' times are looked at every second until there is one. All on the
// loop's thread.
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
    // Traces of a save: times and numbers of the database, of the file that is touched, and of the log.
    struct Marks {
        std::string touched, log;
        bool operator==(const Marks&) const = default;
    };
    Marks marks() const;
    bool watch(); // false when the kernel gives no watch
    void lookLater();
    void readEvents();
    void callSoon();
    void callLater();

    RunLoop& _loop;
    std::string _path, _name, _directory;
    std::function<void()> _changed;
    int _fd = -1;
    RunLoop::Handle _port, _soon, _later, _look;
    Marks _seen; // while there is no watch
    ObservationHandle _signal;
};

} // namespace rolvane
