#pragma once

#include "conduits/UserAlert.h"

namespace rolvane {

// Alerts through org.freedesktop.Notifications on the session bus; the message goes to the system log as well. Without
// a bus or a notification service the log line is all there is.
class DesktopAlert : public UserAlert {
public:
    void show(const Text& text) override;
    void tell(const Text& text) override;
};

} // namespace rolvane
