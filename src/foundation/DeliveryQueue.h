#pragma once

#include "foundation/Mutex.h"
#include "foundation/Notification.h"

#include <atomic>
#include <list>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

// Throws kCXInvalidArgumentException for a name that cannot be a D-Bus member.
void requireNotificationName(const std::string& name);

// The observers of a distributed centre and the deliveries that wait for them, with coalescing. Decides what is
// delivered and in which order; who calls the handlers, and when, is the owner's matter. Any thread.
class DeliveryQueue {
public:
    static constexpr size_t kMostWaiting = 10'000;

    struct Delivery;
    struct Observer {
        std::string name;
        NotificationHandler handler;
        bool coalesce = false;
        std::atomic<bool> ended{false};
        std::optional<std::list<Delivery>::iterator> waiting; // of a coalescing observer; the queue's
    };
    struct Delivery {
        std::shared_ptr<Observer> observer;
        Notification notification;
    };

    std::shared_ptr<Observer> add(std::string name, NotificationHandler handler, bool coalesce);
    void end(const std::shared_ptr<Observer>& observer); // and what waits for it
    bool observes(const std::string& name) const;
    std::vector<std::string> names() const; // observed, each once

    void arrive(const Notification& notification);
    std::optional<Delivery> take(); // the next one; none when nothing waits
    bool empty() const;

private:
    void removeFirst() REQUIRES(_mutex);

    mutable Mutex _mutex;
    std::vector<std::shared_ptr<Observer>> _observers GUARDED_BY(_mutex); // in order of registration
    std::list<Delivery> _waiting GUARDED_BY(_mutex);
    bool _overflowLogged GUARDED_BY(_mutex) = false;
};

} // namespace rolvane
