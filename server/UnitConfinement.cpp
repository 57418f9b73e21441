#include "server/UnitConfinement.h"

namespace rolvane {

namespace {

constexpr const char* kLines = R"(PrivateUsers=yes
NoNewPrivileges=yes
CapabilityBoundingSet=
ProtectSystem=strict
PrivateTmp=yes
PrivateDevices=yes
PrivateMounts=yes
ProtectKernelTunables=yes
ProtectKernelModules=yes
ProtectKernelLogs=yes
ProtectControlGroups=yes
ProtectClock=yes
ProtectHostname=yes
RestrictAddressFamilies=AF_UNIX AF_INET AF_INET6 AF_NETLINK
RestrictNamespaces=yes
RestrictRealtime=yes
RestrictSUIDSGID=yes
LockPersonality=yes
SystemCallArchitectures=native
SystemCallFilter=@system-service
SystemCallFilter=~@privileged
SystemCallErrorNumber=EPERM
UMask=0077
)";

// In quotation marks; a percent sign that begins no specifier of ours is doubled.
std::string word(const std::string& place) {
    std::string text;
    for (size_t i = 0; i < place.size(); ++i) {
        if (place[i] == '"' || place[i] == '\\') text += '\\';
        if (place[i] == '%' && i > 0) text += '%';
        text += place[i];
    }
    return " \"-" + text + "\"";
}

} // namespace

std::string unitConfinement(const std::vector<std::string>& writtenPlaces) {
    std::string text = kLines;
    if (writtenPlaces.empty()) return text;
    text += "ReadWritePaths=";
    for (const std::string& place : writtenPlaces) text += word(place);
    return text + "\n";
}

} // namespace rolvane
