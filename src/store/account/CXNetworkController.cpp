#include "store/account/CXNetworkController.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Notification.h"
#include "foundation/RunLoop.h"
#include "store/account/Account.h"

#include <arpa/inet.h>
#include <cerrno>
#include <cstring>
#include <ifaddrs.h>
#include <linux/netlink.h>
#include <linux/rtnetlink.h>
#include <net/if.h>
#include <sys/socket.h>
#include <unistd.h>

namespace rolvane {

namespace {

constexpr double kQuietSeconds = 0.5;

// Whether the kernel has a route: connecting a datagram socket sends nothing.
bool hasRoute(const sockaddr* address, socklen_t length) {
    const int fd = socket(address->sa_family, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (fd < 0) return false;
    const bool routed = connect(fd, address, length) == 0;
    close(fd);
    return routed;
}

bool anyInterfaceIsUp() {
    ifaddrs* list = nullptr;
    if (getifaddrs(&list) != 0) return true; // not known: let the request find out
    bool up = false;
    for (const ifaddrs* i = list; i; i = i->ifa_next) {
        if (!i->ifa_addr || (i->ifa_flags & IFF_LOOPBACK) || !(i->ifa_flags & IFF_UP) || !(i->ifa_flags & IFF_RUNNING))
            continue;
        up = up || i->ifa_addr->sa_family == AF_INET || i->ifa_addr->sa_family == AF_INET6;
    }
    freeifaddrs(list);
    return up;
}

int openRouteSocket() {
    const int fd = socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC | SOCK_NONBLOCK, NETLINK_ROUTE);
    if (fd < 0) return -1;
    sockaddr_nl address{};
    address.nl_family = AF_NETLINK;
    address.nl_groups = RTMGRP_LINK | RTMGRP_IPV4_IFADDR | RTMGRP_IPV6_IFADDR | RTMGRP_IPV4_ROUTE | RTMGRP_IPV6_ROUTE;
    if (bind(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0) return fd;
    close(fd);
    return -1;
}

} // namespace

struct CXNetworkController::Impl {
    int fd = -1;
    RunLoop* loop = nullptr;
    NotificationCenter* center = nullptr;
    RunLoop::Handle port, timer;

    ~Impl() { stop(); }

    void stop() {
        port.reset();
        timer.reset();
        if (fd >= 0) close(fd);
        fd = -1;
        loop = nullptr;
        center = nullptr;
    }

    void drain() {
        char buffer[8192];
        ssize_t n;
        while ((n = recv(fd, buffer, sizeof buffer, 0)) > 0 || (n < 0 && (errno == EINTR || errno == ENOBUFS))) {
        }
    }

    void changed() {
        if (!loop) return;
        timer = loop->scheduleTimer(kQuietSeconds, [this] {
            timer.reset();
            if (center) center->post({kCXNetworkConfigurationDidChangeNotification, std::nullopt, {}});
        });
    }
};

CXNetworkController::CXNetworkController() : _impl(std::make_unique<Impl>()) {}
CXNetworkController::~CXNetworkController() = default;

CXNetworkController& CXNetworkController::sharedNetworkController() {
    static CXNetworkController controller;
    return controller;
}

bool CXNetworkController::canReachAddress(const std::string& host) {
    if (host.empty()) return false;
    if (isLoopbackHost(host)) return true;
    sockaddr_in v4{};
    v4.sin_family = AF_INET;
    v4.sin_port = htons(443);
    if (inet_pton(AF_INET, host.c_str(), &v4.sin_addr) == 1)
        return hasRoute(reinterpret_cast<const sockaddr*>(&v4), sizeof v4);
    sockaddr_in6 v6{};
    v6.sin6_family = AF_INET6;
    v6.sin6_port = htons(443);
    if (inet_pton(AF_INET6, host.c_str(), &v6.sin6_addr) == 1)
        return hasRoute(reinterpret_cast<const sockaddr*>(&v6), sizeof v6);
    return anyInterfaceIsUp();
}

void CXNetworkController::startMonitoring(RunLoop& loop, NotificationCenter& center) {
    _impl->stop();
    _impl->loop = &loop;
    _impl->center = &center;
    _impl->fd = openRouteSocket();
    if (_impl->fd < 0) {
        CXLog("Changes of the network are not noticed: %@", std::string(strerror(errno)));
        return;
    }
    _impl->port = loop.addPort(_impl->fd, [this](uint32_t) {
        _impl->drain();
        _impl->changed();
    });
}

void CXNetworkController::stopMonitoring() {
    _impl->stop();
}
void CXNetworkController::configurationDidChange() {
    _impl->changed();
}

} // namespace rolvane
