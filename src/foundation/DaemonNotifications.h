#pragma once

#include "foundation/BusNotifications.h"
#include "foundation/ControlClient.h"
#include "foundation/ControlServer.h"
#include "foundation/Mutex.h"

namespace rolvane {

// Daemon and commands meet on two carriers: the session bus, where others can listen, too, and the daemon's control
// socket, which reaches it whatever bus either is on, and where there is none. Each notification carries an id and is
// delivered once. See docs/formats.md for both forms.

// The daemon's side.
class DaemonChannel : public DistributedNotifications {
public:
    explicit DaemonChannel(RunLoop& loop);
    ~DaemonChannel() override;

    // Listens at the path. What commands post is answered from now on and kept until `serve`. A socket that cannot be
    // made is logged; then there is only the bus.
    void listen(const std::string& path);
    void serve();            // observers are there: delivers what was kept, and what comes
    void removeFile() const; // before the process ends without running destructors; any thread

    bool post(const Notification& notification) override;
    ObservationHandle observe(std::string name, NotificationHandler handler, bool coalesce) override;
    void setSuspended(bool suspended) override { _bus.setSuspended(suspended); }
    bool connected() const override;

private:
    void arrived(const Notification& notification); // the server's thread

    BusNotifications _bus;
    Mutex _mutex;
    bool _serving GUARDED_BY(_mutex) = false;
    std::vector<Notification> _kept GUARDED_BY(_mutex);
    std::unique_ptr<ControlServer> _server;
};

// A command's side.
class DaemonLink : public DistributedNotifications {
public:
    DaemonLink(RunLoop& loop, ControlClient::Finder find);

    bool post(const Notification& notification) override;
    ObservationHandle observe(std::string name, NotificationHandler handler, bool coalesce) override;
    void setSuspended(bool suspended) override { _bus.setSuspended(suspended); }
    bool connected() const override { return _bus.connected() || _socket->connect(); }

    // For evidence that the daemon lives; see there.
    ControlClient& socket() { return *_socket; }
    // As `post`; the number of the answer to wait for, none when no socket leads to the daemon.
    std::optional<int64_t> postForAnswer(const Notification& notification);

private:
    BusNotifications _bus;
    std::shared_ptr<ControlClient> _socket;
};

} // namespace rolvane
