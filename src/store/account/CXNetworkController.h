#pragma once

#include <memory>
#include <string>

namespace rolvane {

class NotificationCenter;
class RunLoop;

// Posted in-process when addresses or links changed, half a second after the last change.
inline constexpr const char* kCXNetworkConfigurationDidChangeNotification =
    "kCXNetworkConfigurationDidChangeNotification";

// Says whether the machine's network could carry a packet to a host, and tells when that may have changed.
class CXNetworkController {
public:
    // The process's own. It posts nothing until `startMonitoring`.
    static CXNetworkController& sharedNetworkController();

    CXNetworkController();
    virtual ~CXNetworkController();

    // No packet is sent and no name is looked up: loopback hosts always; a literal address when there is a route to
    // it; a name when an interface other than loopback is up with an address. An empty host: false. Any thread.
    virtual bool canReachAddress(const std::string& host);

    // Watches the kernel's route socket on the loop, and posts on the loop's thread. Again with another loop: moves.
    void startMonitoring(RunLoop& loop, NotificationCenter& center);
    void stopMonitoring();
    // What a change in the kernel does; for tests and for platforms without a route socket. On the loop's thread.
    void configurationDidChange();

private:
    struct Impl;
    std::unique_ptr<Impl> _impl;
};

} // namespace rolvane
