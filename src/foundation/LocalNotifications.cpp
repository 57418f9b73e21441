#include "foundation/DeliveryQueue.h"
#include "foundation/Mutex.h"

namespace rolvane {

struct LocalNotifications::Impl {
    struct Registration : Observation {
        Registration(std::weak_ptr<Impl> i, std::shared_ptr<DeliveryQueue::Observer> o)
            : impl(std::move(i)), observer(std::move(o)) {}
        ~Registration() override {
            observer->ended = true;
            if (auto alive = impl.lock()) alive->queue.end(observer);
        }
        std::weak_ptr<Impl> impl;
        std::shared_ptr<DeliveryQueue::Observer> observer;
    };

    void deliverWaiting() {
        while (!suspended) {
            auto delivery = queue.take();
            if (!delivery) return;
            if (!delivery->observer->ended) delivery->observer->handler(delivery->notification);
        }
    }

    DeliveryQueue queue;
    std::atomic<bool> suspended{false};
    mutable Mutex mutex;
    std::vector<Notification> posted GUARDED_BY(mutex);
};

LocalNotifications::LocalNotifications() : _impl(std::make_shared<Impl>()) {}
LocalNotifications::~LocalNotifications() = default;

bool LocalNotifications::post(const Notification& notification) {
    requireNotificationName(notification.name);
    // As on a bus, what the poster does with its containers later changes nothing.
    Notification sent{notification.name, notification.object,
                      Value(notification.userInfo).deepMutableCopy().dictionary()};
    auto impl = _impl;
    {
        Lock guard(impl->mutex);
        impl->posted.push_back(sent);
    }
    impl->queue.arrive(sent);
    impl->deliverWaiting();
    return true;
}

ObservationHandle LocalNotifications::observe(std::string name, NotificationHandler handler, bool coalesce) {
    requireNotificationName(name);
    return std::make_unique<Impl::Registration>(_impl, _impl->queue.add(std::move(name), std::move(handler), coalesce));
}

void LocalNotifications::setSuspended(bool suspended) {
    auto impl = _impl;
    impl->suspended = suspended;
    impl->deliverWaiting();
}

std::vector<Notification> LocalNotifications::posted() const {
    Lock guard(_impl->mutex);
    return _impl->posted;
}

void LocalNotifications::clear() {
    Lock guard(_impl->mutex);
    _impl->posted.clear();
}

} // namespace rolvane
