#include "foundation/LoopDelivery.h"

#include "foundation/Log.h"
#include "foundation/Mutex.h"

#include <algorithm>

#include <sys/eventfd.h>
#include <unistd.h>

namespace rolvane {

namespace {

constexpr size_t kOfAValue = 16; // at least

// Takes the value's size from what is left; false when that is not enough.
bool takeSize(const Value& value, size_t& left) {
    size_t own = kOfAValue;
    if (auto* text = value.stringIf()) own += text->size();
    if (value.type() == ValueType::data) own += value.data().size();
    if (own > left) return false;
    left -= own;
    const auto fits = [&](const Value& each) { return takeSize(each, left); };
    if (auto* array = value.arrayIf()) return std::all_of(array->begin(), array->end(), fits);
    auto* dictionary = value.dictionaryIf();
    return !dictionary || std::all_of(dictionary->begin(), dictionary->end(), [&](const auto& entry) {
        return takeSize(Value(entry.first), left) && fits(entry.second);
    });
}

bool isTooLarge(const Notification& notification) {
    size_t left = LoopDelivery::kMostBytes;
    return (notification.object && !takeSize(Value(*notification.object), left)) ||
           !takeSize(Value(notification.userInfo), left);
}

} // namespace

bool SeenPosts::isNew(const std::string& id) {
    if (id.size() > kLongest) return true;
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
    if (isTooLarge(notification)) {
        if (!_largeLogged.exchange(true))
            CXLog("A notification %@ is larger than %@ bytes and is not delivered. Others are not logged.",
                  notification.name, kMostBytes);
        return false;
    }
    if (auto* id = notification.userInfo[kPostIdKey].stringIf()) {
        const std::string known = *id;
        notification.userInfo.remove(kPostIdKey);
        const Lock guard(_seenMutex);
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
