// A TCP relay on the loopback interface that adds a round-trip time, for measuring behind a distant store.
//
//   delayproxy TARGET-PORT MILLISECONDS
//
// Prints the port that it listens on. What arrives is handed on half of the time later, in each direction; what a new
// connection brings waits one whole time more, as the handshake of a real connection would make it. Bandwidth is not
// limited and there is no slow start: faithful for small requests, too good for large bodies.

#include <arpa/inet.h>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <deque>
#include <fcntl.h>
#include <iostream>
#include <memory>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <optional>
#include <string>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>
#include <unordered_map>
#include <unordered_set>

namespace {

using Clock = std::chrono::steady_clock;

class Descriptor {
public:
    explicit Descriptor(int number = -1) : _number(number) {}
    ~Descriptor() {
        if (_number >= 0) ::close(_number);
    }
    Descriptor(const Descriptor&) = delete;
    Descriptor& operator=(const Descriptor&) = delete;
    int get() const { return _number; }

private:
    const int _number;
};

void quick(int fd) {
    const int on = 1;
    fcntl(fd, F_SETFL, O_NONBLOCK);
    setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
}

// One direction of a connection: bytes on their way, the earliest first. An empty piece is the end of the stream.
class Lane {
public:
    Lane(int from, int to) : _from(from), _to(to) {}

    void take(Clock::time_point due) {
        char buffer[65536];
        while (!_inDone) {
            const ssize_t n = ::read(_from, buffer, sizeof buffer);
            if (n < 0 && (errno == EAGAIN || errno == EINTR)) return;
            _inDone = n <= 0;
            _pieces.push_back({due, n > 0 ? std::string(buffer, static_cast<size_t>(n)) : std::string()});
        }
    }

    // When there is more to hand on; nothing when there is not. False in `alive`: the other side is gone.
    std::optional<Clock::time_point> give(Clock::time_point now, bool& alive) {
        while (!_pieces.empty() && _pieces.front().due <= now) {
            std::string& bytes = _pieces.front().bytes;
            if (bytes.empty()) {
                ::shutdown(_to, SHUT_WR);
                outDone = true;
            } else {
                const ssize_t n = ::send(_to, bytes.data(), bytes.size(), MSG_NOSIGNAL);
                if (n < 0 && errno != EAGAIN) alive = false;
                if (n < 0) return now + std::chrono::microseconds(500);
                bytes.erase(0, static_cast<size_t>(n));
                if (!bytes.empty()) return now + std::chrono::microseconds(500);
            }
            _pieces.pop_front();
        }
        return _pieces.empty() ? std::nullopt : std::optional(_pieces.front().due);
    }

    bool outDone = false;

private:
    struct Piece {
        Clock::time_point due;
        std::string bytes;
    };
    const int _from, _to;
    bool _inDone = false;
    std::deque<Piece> _pieces;
};

struct Connection {
    Connection(int nearSide, int farSide, Clock::time_point established)
        : near(nearSide), far(farSide), ready(established), out(nearSide, farSide), in(farSide, nearSide) {}
    Descriptor near, far;
    const Clock::time_point ready; // when the handshake would be over
    Lane out, in;
    bool alive = true;
};

class Proxy {
public:
    Proxy(uint16_t target, std::chrono::microseconds roundTrip)
        : _roundTrip(roundTrip), _listener(socket(AF_INET, SOCK_STREAM, 0)), _poll(epoll_create1(EPOLL_CLOEXEC)) {
        _target.sin_family = AF_INET;
        _target.sin_port = htons(target);
        _target.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        sockaddr_in any = _target;
        any.sin_port = 0;
        if (bind(_listener.get(), reinterpret_cast<sockaddr*>(&any), sizeof any) != 0 ||
            listen(_listener.get(), 128) != 0)
            throw std::runtime_error("no port to listen on");
        fcntl(_listener.get(), F_SETFL, O_NONBLOCK);
        watch(_listener.get(), EPOLLIN);
    }

    uint16_t port() const {
        sockaddr_in own{};
        socklen_t size = sizeof own;
        getsockname(_listener.get(), reinterpret_cast<sockaddr*>(&own), &size);
        return ntohs(own.sin_port);
    }

    [[noreturn]] void run() {
        std::optional<Clock::time_point> wake;
        for (;;) {
            wait(wake);
            wake = handOn();
        }
    }

private:
    void watch(int fd, uint32_t events) {
        epoll_event event{};
        event.events = events;
        event.data.fd = fd;
        epoll_ctl(_poll.get(), EPOLL_CTL_ADD, fd, &event);
    }

    void wait(std::optional<Clock::time_point> wake) {
        timespec time{1, 0};
        if (wake) {
            const auto left = std::max(Clock::duration::zero(), *wake - Clock::now());
            const auto ns = std::chrono::duration_cast<std::chrono::nanoseconds>(left).count();
            time = {ns / 1000000000, ns % 1000000000};
        }
        epoll_event events[64];
        const int n = epoll_pwait2(_poll.get(), events, 64, &time, nullptr);
        for (int i = 0; i < n; ++i) {
            if (events[i].data.fd == _listener.get())
                acceptAll();
            else
                arrived(events[i].data.fd);
        }
    }

    void acceptAll() {
        for (;;) {
            const int near = accept4(_listener.get(), nullptr, nullptr, SOCK_CLOEXEC);
            if (near < 0) return;
            const int far = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
            auto connection = std::make_shared<Connection>(near, far, Clock::now() + _roundTrip);
            if (connect(far, reinterpret_cast<sockaddr*>(&_target), sizeof _target) != 0) continue;
            quick(near);
            quick(far);
            _bySocket[near] = _bySocket[far] = connection;
            _all.insert(connection);
            watch(near, EPOLLIN | EPOLLET);
            watch(far, EPOLLIN | EPOLLET);
        }
    }

    void arrived(int fd) {
        const auto found = _bySocket.find(fd);
        if (found == _bySocket.end()) return;
        Connection& connection = *found->second;
        const auto now = Clock::now();
        if (fd == connection.near.get())
            connection.out.take(std::max(now, connection.ready) + _roundTrip / 2);
        else
            connection.in.take(now + _roundTrip / 2);
    }

    std::optional<Clock::time_point> handOn() {
        std::optional<Clock::time_point> wake;
        const auto now = Clock::now();
        for (auto each = _all.begin(); each != _all.end();) {
            Connection& connection = **each;
            for (Lane* lane : {&connection.out, &connection.in})
                if (const auto due = lane->give(now, connection.alive)) wake = wake ? std::min(*wake, *due) : *due;
            if (connection.alive && !(connection.out.outDone && connection.in.outDone)) {
                ++each;
                continue;
            }
            _bySocket.erase(connection.near.get());
            _bySocket.erase(connection.far.get());
            each = _all.erase(each);
        }
        return wake;
    }

    const std::chrono::microseconds _roundTrip;
    sockaddr_in _target{};
    const Descriptor _listener, _poll;
    std::unordered_map<int, std::shared_ptr<Connection>> _bySocket;
    std::unordered_set<std::shared_ptr<Connection>> _all;
};

} // namespace

int main(int argc, char** argv) {
    if (argc != 3) {
        std::cerr << "usage: delayproxy TARGET-PORT MILLISECONDS\n";
        return 2;
    }
    std::signal(SIGPIPE, SIG_IGN);
    try {
        Proxy proxy(static_cast<uint16_t>(std::atoi(argv[1])),
                    std::chrono::microseconds(static_cast<int64_t>(std::atof(argv[2]) * 1000)));
        std::cout << proxy.port() << std::endl;
        proxy.run();
    } catch (const std::exception& error) {
        std::cerr << "delayproxy: " << error.what() << "\n";
        return 1;
    }
}
