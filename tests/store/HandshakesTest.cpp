// A server that has much to do comes to a TLS handshake late, or ends one. The request has not left yet.
#include "StoreWorld.h"

#include <arpa/inet.h>
#include <atomic>
#include <gtest/gtest.h>
#include <mutex>
#include <poll.h>
#include <sys/socket.h>
#include <thread>
#include <unistd.h>
#include <vector>

namespace rolvane {
namespace {

using namespace test;

int listening(int& port) {
    const int made = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t size = sizeof address;
    if (bind(made, reinterpret_cast<sockaddr*>(&address), size) != 0 || listen(made, 64) != 0 ||
        getsockname(made, reinterpret_cast<sockaddr*>(&address), &size) != 0)
        throw std::runtime_error("no port");
    port = ntohs(address.sin_port);
    return made;
}

// Stands before a store. Ends the first connections when the client's first bytes are here, and lets those of the
// others wait.
class Doorkeeper {
public:
    Doorkeeper(int storePort, int ended, std::chrono::milliseconds wait)
        : _storePort(storePort), _ended(ended), _wait(wait), _listener(listening(_port)),
          _acceptor([this] { accept(); }) {}
    ~Doorkeeper() {
        _stopping = true;
        shutdown(_listener, SHUT_RDWR);
        _acceptor.join();
        close(_listener);
        for (auto& thread : _threads) thread.join();
    }
    Doorkeeper(const Doorkeeper&) = delete;
    Doorkeeper& operator=(const Doorkeeper&) = delete;

    HttpRequest asking(const std::string& method) const {
        HttpRequest r;
        r.method = method;
        r.url = Url("https://localhost:" + std::to_string(_port) + "/dav/alice/x");
        if (method == "PUT" || method == "PROPFIND" || method == "LOCK")
            r.body = std::make_shared<const std::string>("the body");
        return r;
    }
    int connections() const { return _connections; }

private:
    void accept() {
        for (int client; (client = accept4(_listener, nullptr, nullptr, SOCK_CLOEXEC)) >= 0;) {
            const int number = ++_connections;
            _threads.emplace_back([this, client, number] {
                serve(client, number);
                close(client);
            });
        }
    }
    void serve(int client, int number) const {
        char first[1];
        if (recv(client, first, sizeof first, MSG_PEEK) <= 0) return;
        if (number <= _ended) return; // unread bytes: the client gets a reset, or an end
        std::this_thread::sleep_for(_wait);
        const int store = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_in address{};
        address.sin_family = AF_INET;
        address.sin_port = htons(static_cast<uint16_t>(_storePort));
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        if (connect(store, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0) pump(client, store);
        close(store);
    }
    void pump(int a, int b) const {
        while (!_stopping) {
            pollfd both[] = {{a, POLLIN, 0}, {b, POLLIN, 0}};
            if (poll(both, 2, 100) < 0) return;
            for (const auto& [from, to] : {std::pair(a, b), std::pair(b, a)}) {
                char bytes[16384];
                if (!(both[from == a ? 0 : 1].revents)) continue;
                const ssize_t n = recv(from, bytes, sizeof bytes, 0);
                if (n <= 0 || send(to, bytes, static_cast<size_t>(n), MSG_NOSIGNAL) != n) return;
            }
        }
    }

    const int _storePort, _ended;
    const std::chrono::milliseconds _wait;
    int _port = 0;
    const int _listener;
    std::atomic<int> _connections{0};
    std::atomic<bool> _stopping{false};
    std::vector<std::thread> _threads; // the acceptor's, until it has ended
    std::thread _acceptor;
};

constexpr auto kAtOnce = std::chrono::milliseconds(0);

TEST(Handshakes, ThatTheServerEndsAreBegunOnceMoreWhateverTheMethod) {
    const StoreWorld world;
    CurlTransportOptions options;
    options.caFile = world.store.caFile();
    options.http2 = false; // there a body that was refused unread is sent once more, on another connection
    for (const char* method : {"GET", "HEAD", "OPTIONS", "PROPFIND", "PUT", "DELETE", "MKCOL", "UNLOCK", "ACL",
                               "PROPPATCH", "LOCK", "COPY", "MOVE", "REPORT"}) {
        const Doorkeeper door(world.store.status().port, 1, kAtOnce);
        const HttpResponse answer = CurlTransport(options).perform(door.asking(method));
        EXPECT_EQ(answer.error, TransportError::none) << method << ": " << answer.detail;
        EXPECT_EQ(answer.status, 401) << method << ": the door is another origin, which gets no password";
        EXPECT_EQ(door.connections(), 2) << method;
    }
}

TEST(Handshakes, ThatAreEndedTwiceFailTheRequest) {
    const StoreWorld world;
    const Doorkeeper door(world.store.status().port, 1000, kAtOnce);
    EXPECT_EQ(world.transport()->perform(door.asking("GET")).error, TransportError::tls);
    EXPECT_EQ(door.connections(), 2);
}

// Shorter limits than are usual, so that the test need not wait as long as a daemon does.
TEST(Handshakes, HaveAllTheTimeOfTheirRequest) {
    const StoreWorld world;
    const Doorkeeper door(world.store.status().port, 0, std::chrono::milliseconds(4500));
    HttpRequest request = door.asking("GET");
    request.limits.idleSeconds = 4;
    const HttpResponse answer = world.transport()->perform(request);
    EXPECT_EQ(answer.error, TransportError::none) << answer.detail;
    EXPECT_EQ(answer.status, 401);
}

TEST(Handshakes, ThatNeverEndAreGivenUpWithTheRequest) {
    const StoreWorld world;
    const Doorkeeper door(world.store.status().port, 0, std::chrono::milliseconds(3000));
    HttpRequest request = door.asking("GET");
    request.limits.totalSeconds = 1;
    EXPECT_EQ(world.transport()->perform(request).error, TransportError::timedOut);
    EXPECT_EQ(door.connections(), 1);
}

} // namespace
} // namespace rolvane
