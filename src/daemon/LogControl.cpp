#include "daemon/LogControl.h"

#include "foundation/Log.h"
#include "foundation/LogSinks.h"

#include <algorithm>
#include <array>
#include <cerrno>

#include <systemd/sd-bus.h>

namespace rolvane {

namespace {

constexpr const char* kInterface = "org.freedesktop.LogControl1";
// In the order of their severity; the last two show what the daemon does, the others only what went wrong.
constexpr std::array kLevels{"emerg", "alert", "crit", "err", "warning", "notice", "info", "debug"};
constexpr size_t kFirstThatShowsProgress = 6;

using Message = sd_bus_message;
using Error = sd_bus_error;

int append(Message* reply, const std::string& text) {
    return sd_bus_message_append_basic(reply, 's', text.c_str());
}

std::string textOf(Message* message) {
    const char* text = nullptr;
    return sd_bus_message_read_basic(message, 's', &text) > 0 && text ? text : "";
}

int getLevel(sd_bus*, const char*, const char*, const char*, Message* reply, void*, Error*) {
    return append(reply, debugLevel() == 0 ? "notice" : "debug");
}

int setLevel(sd_bus*, const char*, const char*, const char*, Message* value, void*, Error* error) {
    const int level = debugLevelOfName(textOf(value), debugLevel());
    if (level < 0) return sd_bus_error_set(error, SD_BUS_ERROR_INVALID_ARGS, "This is no level of the system log.");
    setDebugLevel(level);
    return 0;
}

int getTarget(sd_bus*, const char*, const char*, const char*, Message* reply, void*, Error*) {
    return append(reply, std::dynamic_pointer_cast<JournalSink>(LogSink::current()) ? "journal" : "console");
}

int setTarget(sd_bus*, const char*, const char*, const char*, Message* value, void*, Error* error) {
    const std::string target = textOf(value);
    if (target == "auto")
        LogSink::install(nullptr);
    else if (target == "journal")
        LogSink::install(std::make_shared<JournalSink>());
    else if (target == "console")
        LogSink::install(std::make_shared<StandardErrorSink>());
    else
        return sd_bus_error_set(error, SD_BUS_ERROR_INVALID_ARGS,
                                "The targets are \"journal\", \"console\" and \"auto\".");
    return 0;
}

int getIdentifier(sd_bus*, const char*, const char*, const char*, Message* reply, void*, Error*) {
    return append(reply, program_invocation_short_name);
}

const sd_bus_vtable kTable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_WRITABLE_PROPERTY("LogLevel", "s", getLevel, setLevel, 0, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_WRITABLE_PROPERTY("LogTarget", "s", getTarget, setTarget, 0, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_PROPERTY("SyslogIdentifier", "s", getIdentifier, 0, SD_BUS_VTABLE_PROPERTY_CONST),
    SD_BUS_VTABLE_END,
};

} // namespace

int debugLevelOfName(const std::string& name, int present) {
    const auto found = std::find(kLevels.begin(), kLevels.end(), name);
    if (found == kLevels.end()) return -1;
    const bool shows = static_cast<size_t>(found - kLevels.begin()) >= kFirstThatShowsProgress;
    return shows ? std::max(present, 1) : 0;
}

void LogControl::SlotCloser::operator()(sd_bus_slot* slot) const {
    sd_bus_slot_unref(slot);
}

LogControl::LogControl(sd_bus* bus, const char* path) {
    sd_bus_slot* slot = nullptr;
    if (bus && sd_bus_add_object_vtable(bus, &slot, path, kInterface, kTable, nullptr) >= 0) _slot.reset(slot);
}

} // namespace rolvane
