#include "daemon/DesktopAlert.h"

#include "foundation/Log.h"

#include <cstdint>
#include <memory>
#include <systemd/sd-bus.h>

namespace rolvane {

namespace {

struct BusCloser {
    void operator()(sd_bus* bus) const { sd_bus_flush_close_unref(bus); }
};
struct MessageUnref {
    void operator()(sd_bus_message* message) const { sd_bus_message_unref(message); }
};
struct SlotUnref {
    void operator()(sd_bus_slot* slot) const { sd_bus_slot_unref(slot); }
};

constexpr const char* kService = "org.freedesktop.Notifications";
constexpr const char* kDesktopEntry = "net.rolvane.Rolvane"; // whose icon stands beside the notice
constexpr const char* kPath = "/org/freedesktop/Notifications";

struct Answer {
    uint32_t id = 0;
    bool given = false;
};

int answered(sd_bus_message* message, void* data, sd_bus_error*) {
    auto* answer = static_cast<Answer*>(data);
    uint32_t id = 0;
    if (sd_bus_message_read_basic(message, 'u', &id) > 0 && id == answer->id) answer->given = true;
    return 0;
}

// The service has gone, and with it the notice that nobody can answer any more.
int serviceLeft(sd_bus_message* message, void* data, sd_bus_error*) {
    const char *name = nullptr, *former = nullptr, *now = nullptr;
    if (sd_bus_message_read(message, "sss", &name, &former, &now) > 0 && now && !*now)
        static_cast<Answer*>(data)->given = true;
    return 0;
}

using Slot = std::unique_ptr<sd_bus_slot, SlotUnref>;

Slot onSignal(sd_bus* bus, const char* sender, const char* path, const char* interface, const char* member,
              sd_bus_message_handler_t handler, Answer& answer) {
    sd_bus_slot* slot = nullptr;
    sd_bus_match_signal(bus, &slot, sender, path, interface, member, handler, &answer);
    return Slot(slot);
}

using Bus = std::unique_ptr<sd_bus, BusCloser>;

Bus userBus() {
    sd_bus* raw = nullptr;
    return Bus(sd_bus_open_user(&raw) < 0 ? nullptr : raw);
}

} // namespace

void DesktopAlert::tell(const Text& text) {
    CXLog("%s %s", text.header, text.message);
    const Bus bus = userBus();
    if (!bus) return;
    constexpr uint64_t kPatience = 2000000; // microseconds
    sd_bus_set_method_call_timeout(bus.get(), kPatience);
    sd_bus_call_method(bus.get(), kService, kPath, kService, "Notify", nullptr, nullptr, "susssasa{sv}i", "Rolvane", 0u,
                       text.icon.c_str(), text.header.c_str(), text.message.c_str(), 0, 2, "urgency", "y", 1,
                       "desktop-entry", "s", kDesktopEntry, -1);
}

void DesktopAlert::show(const Text& text) {
    CXLog("%s %s", text.header, text.message);
    const Bus bus = userBus();
    if (!bus) return;
    sd_bus* raw = bus.get();

    Answer answer;
    const Slot closed = onSignal(raw, kService, kPath, kService, "NotificationClosed", answered, answer);
    const Slot chosen = onSignal(raw, kService, kPath, kService, "ActionInvoked", answered, answer);
    sd_bus_slot* left = nullptr;
    sd_bus_add_match(raw, &left,
                     "type='signal',sender='org.freedesktop.DBus',interface='org.freedesktop.DBus',"
                     "member='NameOwnerChanged',arg0='org.freedesktop.Notifications'",
                     serviceLeft, &answer);
    const Slot ownsLeft(left);

    constexpr uint8_t kCritical = 2;
    const bool plain = text.level >= kPlainLevel;
    sd_bus_message* reply = nullptr;
    const int sent = sd_bus_call_method(raw, kService, kPath, kService, "Notify", nullptr, &reply, "susssasa{sv}i",
                                        "Rolvane", 0u, text.icon.c_str(), text.header.c_str(), text.message.c_str(), 2,
                                        "default", text.defaultButton.c_str(), 2, "urgency", "y", plain ? 1 : kCritical,
                                        "desktop-entry", "s", kDesktopEntry, 0);
    const std::unique_ptr<sd_bus_message, MessageUnref> ownsReply(reply);
    if (sent < 0 || sd_bus_message_read_basic(reply, 'u', &answer.id) <= 0) return;

    while (!answer.given) {
        const int handled = sd_bus_process(raw, nullptr);
        if (handled < 0) return;
        if (handled == 0 && sd_bus_wait(raw, UINT64_MAX) < 0) return;
    }
}

} // namespace rolvane
