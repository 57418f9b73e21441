#include "daemon/NotificationAlert.h"

#include "foundation/Log.h"

#include <chrono>
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

} // namespace

bool showDesktopNotification(const std::string& header, const std::string& message, const std::string& button,
                             const std::string& icon, double waitSeconds) {
    CXLog("%s: %s", header, message);
    sd_bus* raw = nullptr;
    if (sd_bus_open_user(&raw) < 0) return false;
    const std::unique_ptr<sd_bus, BusCloser> bus(raw);

    Answer answer;
    sd_bus_slot *closed = nullptr, *chosen = nullptr;
    sd_bus_match_signal(bus.get(), &closed, kService, kPath, kService, "NotificationClosed", answered, &answer);
    sd_bus_match_signal(bus.get(), &chosen, kService, kPath, kService, "ActionInvoked", answered, &answer);
    const std::unique_ptr<sd_bus_slot, SlotUnref> ownsClosed(closed), ownsChosen(chosen);

    sd_bus_message* reply = nullptr;
    const int sent = sd_bus_call_method(bus.get(), kService, kPath, kService, "Notify", nullptr, &reply,
                                        "susssasa{sv}i", "Rolvane", 0u, icon.c_str(), header.c_str(), message.c_str(),
                                        2, "default", button.c_str(), 1, "urgency", "y", 2, 0);
    const std::unique_ptr<sd_bus_message, MessageUnref> ownsReply(reply);
    if (sent < 0 || sd_bus_message_read_basic(reply, 'u', &answer.id) <= 0) return false;

    const auto deadline = std::chrono::steady_clock::now() + std::chrono::duration<double>(waitSeconds);
    while (!answer.given) {
        const auto left =
            std::chrono::duration_cast<std::chrono::microseconds>(deadline - std::chrono::steady_clock::now());
        if (left.count() <= 0) break;
        const int handled = sd_bus_process(bus.get(), nullptr);
        if (handled < 0) break;
        if (handled == 0 && sd_bus_wait(bus.get(), static_cast<uint64_t>(left.count())) < 0) break;
    }
    return true;
}

} // namespace rolvane
