#pragma once

#include "foundation/Value.h"

#include <functional>
#include <memory>
#include <optional>
#include <string>

namespace rolvane {

class RunLoop;

struct Notification {
    std::string name;
    std::optional<std::string> object; // the sender's object string, when there is one
    Dictionary userInfo;
};
using NotificationHandler = std::function<void(const Notification&)>;

// Ends its registration when destroyed.
class Observation {
public:
    virtual ~Observation() = default;
};
using ObservationHandle = std::unique_ptr<Observation>;

// The process's own notification centre. `post` calls the observers on the posting thread, in order of registration,
// before it returns; an observer may register and end registrations meanwhile. Any thread.
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
class DistributedNotifications {
public:
    virtual ~DistributedNotifications() = default;
    // Delivers immediately; true when it went out. Any thread. Without a bus nothing happens and false is returned.
    virtual bool post(const Notification& notification) = 0;
    // The handler runs on the run loop that was given at construction. Coalescing: while `suspended` or while the loop
    // is busy, equal names are delivered once, with the latest user data.
    [[nodiscard]] virtual ObservationHandle observe(std::string name, NotificationHandler handler, bool coalesce) = 0;
    virtual void setSuspended(bool suspended) = 0;
    virtual bool connected() const = 0;
};

// D-Bus signals on the session bus: path /net/rolvane/Notifications, interface net.rolvane.Notifications, member = the
// notification's name, body a{sv} (user data; the object string, when present, under the key "object").
// Observers hear their own process's signals too. `address` none: the session bus of the environment.
std::unique_ptr<DistributedNotifications> makeBusNotifications(RunLoop& loop,
                                                               std::optional<std::string> address = std::nullopt);
// In memory, for tests and for a process without a bus: records what is posted and delivers at once to its observers.
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
