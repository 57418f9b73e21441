#include "foundation/LoopDelivery.h"

#include <sys/eventfd.h>
#include <unistd.h>

namespace rolvane {

bool SeenPosts::isNew(const std::string& id) {
    if (!_seen.insert(id).second) return false;
    _order.push_back(id);
    if (_order.size() > kMost) {
        _seen.erase(_order.front());
        _order.pop_front();
    }
    return true;
}

LoopDelivery::LoopDelivery(RunLoop& loop) : _loop(loop), _arrived(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
    if (_arrived < 0) return;
    _arrivedPort = _loop.addPort(_arrived, [this](uint32_t) {
        eventfd_t ignored;
        ::eventfd_read(_arrived, &ignored);
        deliverSoon();
    });
}

LoopDelivery::~LoopDelivery() {
    _arrivedPort.reset();
    if (_arrived >= 0) ::close(_arrived);
}

// False for one that has come already.
bool LoopDelivery::enqueue(Notification notification) {
    if (auto* id = notification.userInfo[kPostIdKey].stringIf()) {
        const std::string known = *id;
        notification.userInfo.remove(kPostIdKey);
        const std::lock_guard guard(_seenMutex);
        if (!_seen.isNew(known)) return false;
    }
    _queue.arrive(notification);
    return true;
}

void LoopDelivery::arrive(Notification notification) {
    if (enqueue(std::move(notification))) deliverSoon();
}

void LoopDelivery::arriveFromAnyThread(Notification notification) {
    if (enqueue(std::move(notification))) ::eventfd_write(_arrived, 1);
}

void LoopDelivery::setSuspended(bool suspended) {
    _suspended = suspended;
    deliverSoon();
}

void LoopDelivery::deliverSoon() {
    if (_suspended || _deliveryScheduled || _queue.empty()) return;
    _deliveryScheduled = true;
    _loop.performAfterDelay(0, [weak = weak_from_this()] {
        if (auto self = weak.lock()) self->deliverNext();
    });
}

// One delivery a turn: between two the loop reads what has come in, which may coalesce with what waits.
void LoopDelivery::deliverNext() {
    _deliveryScheduled = false;
    if (_suspended) return;
    auto delivery = _queue.take();
    deliverSoon(); // first, since the handler may throw
    if (delivery && !delivery->observer->ended) delivery->observer->handler(delivery->notification);
}

} // namespace rolvane
