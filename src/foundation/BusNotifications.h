#pragma once

#include "foundation/BusPoster.h"
#include "foundation/LoopDelivery.h"

struct sd_event_source;

namespace rolvane {

class BusReceiver;

// The notifications of `makeBusNotifications`. What other carriers bring is put into `delivery`.
class BusNotifications : public DistributedNotifications {
public:
    BusNotifications(RunLoop& loop, const std::optional<std::string>& address);
    ~BusNotifications() override;

    bool post(const Notification& notification) override { return _poster.post(notification); }
    ObservationHandle observe(std::string name, NotificationHandler handler, bool coalesce) override;
    void setSuspended(bool suspended) override { _delivery->setSuspended(suspended); }
    bool connected() const override { return _poster.connected(); }
    const std::shared_ptr<LoopDelivery>& delivery() const { return _delivery; }

private:
    struct SourceCloser {
        void operator()(sd_event_source* source) const;
    };
    using EventSource = std::unique_ptr<sd_event_source, SourceCloser>;
    static int somethingQueued(sd_event_source*, int, uint32_t, void* self);
    static int retryElapsed(sd_event_source*, uint64_t, void* self);
    int writeQueued();

    mutable BusPoster _poster;
    EventSource _queuedSource, _queuedRetry;
    std::shared_ptr<LoopDelivery> _delivery;
    std::shared_ptr<BusReceiver> _receiver;
};

} // namespace rolvane
