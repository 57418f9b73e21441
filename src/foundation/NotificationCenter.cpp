#include "foundation/Mutex.h"
#include "foundation/Notification.h"

#include <algorithm>
#include <atomic>
#include <vector>

namespace rolvane {

struct NotificationCenter::Impl {
    struct Observer {
        std::string name;
        NotificationHandler handler;
        std::atomic<bool> ended{false};
    };

    struct Registration : Observation {
        Registration(std::weak_ptr<Impl> c, std::shared_ptr<Observer> o)
            : center(std::move(c)), observer(std::move(o)) {}
        ~Registration() override {
            observer->ended = true;
            if (auto impl = center.lock()) impl->remove(observer);
        }
        std::weak_ptr<Impl> center;
        std::shared_ptr<Observer> observer;
    };

    void remove(const std::shared_ptr<Observer>& observer) {
        Lock guard(mutex);
        std::erase(observers, observer);
    }

    std::vector<std::shared_ptr<Observer>> observersOf(const std::string& name) const {
        Lock guard(mutex);
        std::vector<std::shared_ptr<Observer>> out;
        std::copy_if(observers.begin(), observers.end(), std::back_inserter(out),
                     [&](const auto& observer) { return observer->name == name; });
        return out;
    }

    mutable Mutex mutex;
    std::vector<std::shared_ptr<Observer>> observers GUARDED_BY(mutex); // in order of registration
};

NotificationCenter::NotificationCenter() : _impl(std::make_shared<Impl>()) {}
NotificationCenter::~NotificationCenter() = default;

NotificationCenter& NotificationCenter::defaultCenter() {
    static auto* center = new NotificationCenter; // registrations may end after everything else
    return *center;
}

ObservationHandle NotificationCenter::observe(std::string name, NotificationHandler handler) {
    auto observer = std::make_shared<Impl::Observer>();
    observer->name = std::move(name);
    observer->handler = std::move(handler);
    {
        Lock guard(_impl->mutex);
        _impl->observers.push_back(observer);
    }
    return std::make_unique<Impl::Registration>(_impl, std::move(observer));
}

void NotificationCenter::post(const Notification& notification) {
    for (const auto& observer : _impl->observersOf(notification.name))
        if (!observer->ended) observer->handler(notification);
}

} // namespace rolvane
