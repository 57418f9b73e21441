#include "foundation/DeliveryQueue.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"

#include <algorithm>
#include <set>

#include <fmt/format.h>

namespace rolvane {

namespace {

bool isLetter(char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || c == '_';
}
bool isLetterOrDigit(char c) {
    return isLetter(c) || (c >= '0' && c <= '9');
}

} // namespace

void requireNotificationName(const std::string& name) {
    bool good = !name.empty() && name.size() <= 255 && isLetter(name[0]) &&
                std::all_of(name.begin(), name.end(), isLetterOrDigit);
    if (!good)
        throw CXException(
            kCXInvalidArgumentException,
            fmt::format("\"{}\" cannot be the name of a notification: it takes 1 to 255 letters, digits and "
                        "underscores, and no digit first.",
                        name));
}

std::shared_ptr<DeliveryQueue::Observer> DeliveryQueue::add(std::string name, NotificationHandler handler,
                                                            bool coalesce) {
    auto observer = std::make_shared<Observer>();
    observer->name = std::move(name);
    observer->handler = std::move(handler);
    observer->coalesce = coalesce;
    Lock guard(_mutex);
    _observers.push_back(observer);
    return observer;
}

void DeliveryQueue::end(const std::shared_ptr<Observer>& observer) {
    observer->ended = true;
    std::list<Delivery> dropped; // destroyed without the lock
    Lock guard(_mutex);
    std::erase(_observers, observer);
    for (auto it = _waiting.begin(); it != _waiting.end();) {
        auto next = std::next(it);
        if (it->observer == observer) dropped.splice(dropped.end(), _waiting, it);
        it = next;
    }
    observer->waiting.reset();
}

bool DeliveryQueue::observes(const std::string& name) const {
    Lock guard(_mutex);
    return std::any_of(_observers.begin(), _observers.end(), [&](const auto& o) { return o->name == name; });
}

std::vector<std::string> DeliveryQueue::names() const {
    Lock guard(_mutex);
    std::set<std::string> all;
    for (const auto& observer : _observers) all.insert(observer->name);
    return {all.begin(), all.end()};
}

void DeliveryQueue::removeFirst() {
    _waiting.front().observer->waiting.reset();
    _waiting.pop_front();
}

void DeliveryQueue::arrive(const Notification& notification) {
    bool logOverflow = false;
    {
        Lock guard(_mutex);
        for (const auto& observer : _observers) {
            if (observer->name != notification.name) continue;
            if (observer->waiting) {
                (*observer->waiting)->notification = notification;
                continue;
            }
            _waiting.push_back({observer, notification});
            if (observer->coalesce) observer->waiting = std::prev(_waiting.end());
        }
        while (_waiting.size() > kMostWaiting) {
            removeFirst();
            logOverflow = !std::exchange(_overflowLogged, true);
        }
    }
    if (logOverflow)
        CXLog("More than %@ notifications wait for their observers: the oldest are dropped.", kMostWaiting);
}

std::optional<DeliveryQueue::Delivery> DeliveryQueue::take() {
    Lock guard(_mutex);
    if (_waiting.empty()) return {};
    auto delivery = std::move(_waiting.front());
    _waiting.pop_front();
    delivery.observer->waiting.reset();
    return delivery;
}

bool DeliveryQueue::empty() const {
    Lock guard(_mutex);
    return _waiting.empty();
}

} // namespace rolvane
