#include "StoreTestWorld.h"

#include <arpa/inet.h>
#include <chrono>
#include <gtest/gtest.h>
#include <memory>
#include <netinet/in.h>
#include <openssl/ssl.h>
#include <ostream>
#include <stdexcept>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>
#include <vector>

// Whoever may connect can hold connections without ever signing in. Users must not notice.

namespace rolvane {
namespace {

constexpr int kStrangers = 500;

// How far each of the stranger's connections goes before it says nothing more.
enum class Silence { fromTheStart, afterOneByte, afterTheHandshake, withinARequest, afterARefusal };

std::ostream& operator<<(std::ostream& out, Silence silence) {
    constexpr const char* kNames[] = {"FromTheStart", "AfterOneByte", "AfterTheHandshake", "WithinARequest",
                                      "AfterARefusal"};
    return out << kNames[static_cast<int>(silence)];
}

void allowDescriptors() {
    rlimit limit{};
    getrlimit(RLIMIT_NOFILE, &limit);
    limit.rlim_cur = std::min<rlim_t>(limit.rlim_max, 8192);
    setrlimit(RLIMIT_NOFILE, &limit);
}

class Stranger {
public:
    explicit Stranger(int port) : _context(SSL_CTX_new(TLS_client_method())), _port(port) { allowDescriptors(); }
    ~Stranger() {
        for (SSL* session : _sessions) SSL_free(session);
        for (int each : _sockets) close(each);
        SSL_CTX_free(_context);
    }
    Stranger(const Stranger&) = delete;

    void hold(Silence silence) {
        const int s = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        if (s < 0) throw std::runtime_error("no more sockets");
        _sockets.push_back(s);
        sockaddr_in address{};
        address.sin_family = AF_INET;
        address.sin_port = htons(static_cast<uint16_t>(_port));
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        // The server may be slow to take them, and may close what it has had enough of.
        const timeval patience{2, 0};
        setsockopt(s, SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
        setsockopt(s, SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
        if (connect(s, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) return;
        if (silence == Silence::afterOneByte) {
            EXPECT_EQ(send(s, "\x16", 1, MSG_NOSIGNAL), 1);
            return;
        }
        if (silence == Silence::fromTheStart) return;
        SSL* session = SSL_new(_context);
        _sessions.push_back(session);
        SSL_set_fd(session, s);
        if (SSL_connect(session) != 1) return;
        char answer[4096];
        if (silence == Silence::withinARequest) SSL_write(session, "GET /dav/ HTTP/1.1\r\nHo", 22);
        if (silence != Silence::afterARefusal) return;
        const std::string request = "GET /dav/ HTTP/1.1\r\nHost: localhost\r\n\r\n";
        SSL_write(session, request.data(), static_cast<int>(request.size()));
        SSL_read(session, answer, sizeof answer);
    }

private:
    SSL_CTX* _context;
    int _port;
    std::vector<int> _sockets;
    std::vector<SSL*> _sessions;
};

class SilentStrangers : public testing::TestWithParam<Silence> {};

TEST_P(SilentStrangers, KeepNobodyWaiting) {
    const StoreDirectory directory;
    PrivateStore store(optionsIn(directory));
    store.addUser("alice", "word");
    store.start();
    const CurlClient alice(store, "alice", "word");
    ASSERT_EQ(alice.request("PUT", "/alice/x", {}, "x").status, 201);
    Stranger stranger(store.status().port);
    for (int i = 0; i < kStrangers; ++i) stranger.hold(GetParam());
    for (int i = 0; i < 5; ++i) {
        const auto began = std::chrono::steady_clock::now();
        EXPECT_EQ(alice.request("GET", "/alice/x").status, 200);
        const std::chrono::duration<double> waited = std::chrono::steady_clock::now() - began;
        EXPECT_LT(waited.count(), 4) << "seconds";
        std::printf("request %d waited %.3f s\n", i, waited.count());
    }
}

INSTANTIATE_TEST_SUITE_P(Each, SilentStrangers,
                         testing::Values(Silence::fromTheStart, Silence::afterOneByte, Silence::afterTheHandshake,
                                         Silence::withinARequest, Silence::afterARefusal),
                         testing::PrintToStringParamName());

} // namespace
} // namespace rolvane
