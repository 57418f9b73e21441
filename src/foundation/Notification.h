#pragma once

#include "foundation/Value.h"

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

class RunLoop;

struct Notification {
    std::string name;
    std::optional<std::string> object; // the sender's object string, when there is one
    Dictionary userInfo;
};
using NotificationHandler = std::function<void(const Notification&)>;

// Ends its registration when destroyed: the handler is not called again. Destroying it on another thread than the
// handler's does not wait for a call that is under way. It may outlive its centre.
class Observation {
public:
    virtual ~Observation() = default;
};
using ObservationHandle = std::unique_ptr<Observation>;

// The process's own notification centre. `post` calls the observers on the posting thread, in order of registration,
// before it returns; an observer may register and end registrations meanwhile (one that is new hears from the next post
// on). What a handler throws reaches the poster. Any thread.
class NotificationCenter {
public:
    NotificationCenter();
    ~NotificationCenter();
    static NotificationCenter& defaultCenter();
    [[nodiscard]] ObservationHandle observe(std::string name, NotificationHandler handler); // any object
    void post(const Notification& notification);

private:
    struct Impl;
    std::shared_ptr<Impl> _impl;
};

// Notifications between the processes of one user. Exists as an interface so that tests can replace the bus.
// A name is a D-Bus member ([A-Za-z_][A-Za-z0-9_]*, at most 255 bytes); others throw kCXInvalidArgumentException.
// All but `post` and `connected` is called on the run loop's thread.
class DistributedNotifications {
public:
    virtual ~DistributedNotifications() = default;
    // Delivers immediately; true when it went out. Any thread. Without a bus nothing happens and false is returned.
    // Never waits for an answer. A bus that is slow or hangs holds up the poster for a fraction of a second in all;
    // from then on a bounded number of notifications waits for it (true), and further ones are dropped (false).
    virtual bool post(const Notification& notification) = 0;
    // The handler runs on the run loop that was given at construction. Coalescing: while `suspended` or while the loop
    // is busy, equal names are delivered once, with the latest user data, in the place of the earliest. Without
    // coalescing all are delivered in order; of those that wait the oldest go when there are more than 10,000.
    [[nodiscard]] virtual ObservationHandle observe(std::string name, NotificationHandler handler, bool coalesce) = 0;
    virtual void setSuspended(bool suspended) = 0;
    virtual bool connected() const = 0;
};

// D-Bus signals on the session bus: path /net/rolvane/Notifications, interface net.rolvane.Notifications, member = the
// notification's name, body a{sv} (user data; the object string, when present, under the key "object").
// Values: boolean b, integer x, real d, string s (what is not UTF-8 is replaced), date (d), data ay, array av,
// dictionary a{sv}, absent in an array g; 16 containers
// inside one another at most, the user data counted. Signals with another body are heard with what can be read of it.
// Observers hear their own process's signals too; what `observe` was called for is heard from its return on. A bus that
// went away is looked for with the next `post`, and every few seconds while anything is observed. `address` none: the
// session bus of the environment ($DBUS_SESSION_BUS_ADDRESS, else $XDG_RUNTIME_DIR/bus), as it is now.
std::unique_ptr<DistributedNotifications> makeBusNotifications(RunLoop& loop,
                                                               std::optional<std::string> address = std::nullopt);

// In memory, for tests and for a process without a bus: records what is posted and delivers at once, on the posting
// thread, to its observers. `post` is true. Any thread.
class LocalNotifications : public DistributedNotifications {
public:
    LocalNotifications();
    ~LocalNotifications() override;
    bool post(const Notification& notification) override;
    ObservationHandle observe(std::string name, NotificationHandler handler, bool coalesce) override;
    void setSuspended(bool suspended) override;
    bool connected() const override { return false; }
    std::vector<Notification> posted() const; // all so far, in order
    void clear();

private:
    struct Impl;
    std::shared_ptr<Impl> _impl;
};

} // namespace rolvane
