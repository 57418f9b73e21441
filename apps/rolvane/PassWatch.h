#pragma once

#include "Context.h"
#include "foundation/Notification.h"

#include <functional>
#include <optional>
#include <string>

namespace rolvane::cli {

// Hears what the daemon says of its passes, from construction on.
class PassWatch {
public:
    // Without progress, which is a notification a contact, the bus and this process have nothing to do for it.
    explicit PassWatch(Context& context, bool progress = true);

    // What came: one of the three notifications, with location and fraction for progress.
    struct Event {
        enum class Kind { started, progress, stopped } kind;
        std::string location;
        double fraction = 0;
    };
    std::function<void(const Event&)> onEvent; // on this thread, while it waits

    // Waits until the test holds: it is asked at once, when a pass has started or stopped, and twice a second, as an
    // event may have been missed. False when the time ran out.
    bool waitUntil(const std::function<bool()>& test, double seconds);

    int started() const { return _started; }
    int stopped() const { return _stopped; }

private:
    void heard(const Event& event);
    Context& _context;
    std::vector<ObservationHandle> _observations;
    int _started = 0, _stopped = 0;
    bool _news = false;
};

} // namespace rolvane::cli
