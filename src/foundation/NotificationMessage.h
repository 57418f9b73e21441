#pragma once

#include "foundation/Notification.h"

#include <memory>

#include <systemd/sd-bus.h>

namespace rolvane {

inline constexpr const char* kNotificationPath = "/net/rolvane/Notifications";
inline constexpr const char* kNotificationInterface = "net.rolvane.Notifications";

struct BusMessageCloser {
    void operator()(sd_bus_message* message) const { sd_bus_message_unref(message); }
};
using BusMessage = std::unique_ptr<sd_bus_message, BusMessageCloser>;

// The notification as a signal of this connection. Gives a negative errno when it cannot be one (nested too deep, too
// large); the message is then none.
int makeNotificationMessage(sd_bus* bus, const Notification& notification, BusMessage& message);

// What can be read of a received signal; a body of another form gives no user data.
Notification readNotificationMessage(sd_bus_message* message);

// The text with every byte that is not part of a UTF-8 character, and every NUL, replaced by U+FFFD.
std::string busText(std::string_view text);

} // namespace rolvane
