#pragma once

#include <string>

namespace rolvane {

// Shows a message to the person through org.freedesktop.Notifications on the session bus and waits until it is closed
// or a button is chosen, but at most `waitSeconds`. Without a bus or a notification service the message goes to the
// log. True when a service took it.
bool showDesktopNotification(const std::string& header, const std::string& message, const std::string& button,
                             const std::string& icon, double waitSeconds);

} // namespace rolvane
