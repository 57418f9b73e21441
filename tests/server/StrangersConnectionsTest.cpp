#include "StoreTestWorld.h"
#include "TLSConnection.h"

#include <arpa/inet.h>
#include <chrono>
#include <cstdlib>
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
enum class Silence { fromTheStart, afterOneByte, afterTheHandshake, withinARequest, afterTwoPieces, afterARefusal };

std::ostream& operator<<(std::ostream& out, Silence silence) {
    constexpr const char* kNames[] = {"FromTheStart",   "AfterOneByte",   "AfterTheHandshake",
                                      "WithinARequest", "AfterTwoPieces", "AfterARefusal"};
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
        if (silence == Silence::afterTwoPieces) { // of a head, each a TLS record
            SSL_write(session, "GET /dav/ HTTP/1.1\r\n", 20);
            SSL_write(session, "Ho", 2);
        }
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

// Clients may write a head, and what follows, in as many pieces as they like.
TEST(PiecesOfARequest, AreAnsweredHoweverManyTLSRecordsTheyAre) {
    const StoreDirectory directory;
    PrivateStore store(optionsIn(directory));
    store.addUser("alice", "word");
    store.start();
    const std::string head = "PUT /dav/alice/x HTTP/1.1\r\nHost: localhost\r\nAuthorization: Basic YWxpY2U6d29yZA==\r\n"
                             "Content-Length: 10\r\n\r\n";
    const std::string two = head + "0123456789" + head + "abcdefghij"; // the second one goes out with the first
    for (const size_t length : {size_t{1}, size_t{7}, head.size() - 1, head.size() + 3, two.size()}) {
        TLSConnection connection(store.status().port);
        for (size_t at = 0; at < two.size(); at += length) connection.write(two.substr(at, length));
        EXPECT_EQ(connection.answers(2), (std::vector<int>{length == 1 ? 201 : 204, 204})) << "pieces of " << length;
    }
    const CurlClient alice(store, "alice", "word");
    EXPECT_EQ(alice.request("GET", "/alice/x").body, "abcdefghij");
}

// httpd closes all kept connections of a process whose threads are all at work.
TEST(SlowUploads, CloseNobodysKeptConnection) {
    constexpr int kUploads = 60;
    const StoreDirectory directory;
    PrivateStoreOptions options = optionsIn(directory);
    options.maximumProcesses = 1;
    options.keepAliveSeconds = 600; // however slow the machine is
    options.extraConfiguration = {"RequestReadTimeout body=600"};
    PrivateStore store(options);
    store.addUser("alice", "word");
    store.start();
    const std::string signIn = " HTTP/1.1\r\nHost: localhost\r\nAuthorization: Basic YWxpY2U6d29yZA==\r\n";
    const std::string looking = "OPTIONS /dav/alice/" + signIn + "\r\n";
    TLSConnection kept(store.status().port);
    kept.write(looking);
    ASSERT_EQ(kept.answers(1), std::vector<int>{200});
    std::vector<std::unique_ptr<TLSConnection>> uploads;
    for (int i = 0; i < kUploads; ++i) {
        uploads.push_back(std::make_unique<TLSConnection>(store.status().port));
        const std::string path = "PUT /dav/alice/f" + std::to_string(i);
        uploads.back()->write(path + signIn + "Expect: 100-continue\r\nContent-Length: 2\r\n\r\n");
        ASSERT_EQ(uploads.back()->answers(1), std::vector<int>{100}) << "upload " << i << " has a thread";
    }
    kept.write(looking);
    EXPECT_EQ(kept.answers(1), std::vector<int>{200});
    for (auto& upload : uploads) {
        upload->write("ab");
        EXPECT_EQ(upload->answers(1), std::vector<int>{201});
    }
}

// One user's bodies that do not come hold a part of the threads, and the others serve whoever else asks.
TEST(SlowUploads, OfOneUserLeaveThreadsToOthers) {
    constexpr int kUploads = 12, kThreads = 8;
    const StoreDirectory directory;
    PrivateStoreOptions options = optionsIn(directory);
    options.threadsPerProcess = kThreads;
    options.maximumProcesses = 1;
    options.extraConfiguration = {"RequestReadTimeout body=600"};
    PrivateStore store(options);
    store.addUser("alice", "word");
    store.addUser("bob", "word");
    store.start();
    const CurlClient bob(store, "bob", "word");
    ASSERT_EQ(bob.request("PUT", "/bob/x", {}, "x").status, 201);
    const std::string signIn = " HTTP/1.1\r\nHost: localhost\r\nAuthorization: Basic YWxpY2U6d29yZA==\r\n";
    std::vector<std::unique_ptr<TLSConnection>> uploads;
    for (int i = 0; i < kUploads; ++i) {
        uploads.push_back(std::make_unique<TLSConnection>(store.status().port));
        // In turns: of the own tree, and of another's, which is refused before its body.
        const std::string path = i % 2 ? "PUT /dav/alice/f" + std::to_string(i) : "PUT /dav/bob/f";
        uploads.back()->write(path + signIn + "Content-Length: 2\r\n\r\n");
    }
    EXPECT_EQ(bob.request("GET", "/bob/x").status, 200);
    int late = 0;
    for (int i = 1; i < kUploads; i += 2) {
        uploads[static_cast<size_t>(i)]->write("ab");
        const auto answer = uploads[static_cast<size_t>(i)]->answers(1);
        ASSERT_EQ(answer.size(), 1u) << i;
        EXPECT_TRUE(answer[0] == 201 || answer[0] == 408) << answer[0];
        late += answer[0] == 408;
    }
    const CurlClient alice(store, "alice", "word");
    EXPECT_EQ(alice.request("PUT", "/alice/x", {}, "x").status, 201);
    std::printf("%d of %d ended with 408\n", late, kUploads / 2);
}

// Nobody waits for the body of a request that is answered with 401 anyway.
TEST(SlowUploads, OfAStrangerHoldNoThread) {
    constexpr int kUploads = 20, kThreads = 8;
    const StoreDirectory directory;
    PrivateStoreOptions options = optionsIn(directory);
    options.threadsPerProcess = kThreads;
    options.maximumProcesses = 1;
    options.extraConfiguration = {"RequestReadTimeout body=600"};
    PrivateStore store(options);
    store.addUser("bob", "word");
    store.start();
    const CurlClient bob(store, "bob", "word");
    ASSERT_EQ(bob.request("PUT", "/bob/x", {}, "x").status, 201);
    std::vector<std::unique_ptr<TLSConnection>> uploads;
    for (int i = 0; i < kUploads; ++i) {
        uploads.push_back(std::make_unique<TLSConnection>(store.status().port));
        // Without a password, with a wrong one, and to a place that is none of a user's.
        const char* heads[] = {"PUT /dav/bob/f HTTP/1.1\r\n",
                               "PUT /dav/bob/f HTTP/1.1\r\nAuthorization: Basic Ym9iOm5vbmU=\r\n",
                               "POST /elsewhere HTTP/1.1\r\n"};
        uploads.back()->write(heads[i % 3] + std::string("Host: localhost\r\nContent-Length: 200000\r\n\r\n"));
    }
    EXPECT_EQ(bob.request("GET", "/bob/x").status, 200);
    for (auto& each : uploads) EXPECT_EQ(each->answers(1).size(), 1u);
    // A body that is there is read, and the connection goes on.
    TLSConnection kept(store.status().port);
    const std::string whole = "PUT /dav/bob/f HTTP/1.1\r\nHost: localhost\r\nContent-Length: 2\r\n\r\nab";
    kept.write(whole + whole);
    EXPECT_EQ(kept.answers(2), (std::vector<int>{401, 401}));
}

// More than the whole server can hold at a time.
TEST_P(SilentStrangers, OfOneAddressGiveWayToOthersWhenTheyAreTooMany) {
    const StoreDirectory directory;
    PrivateStoreOptions options = optionsIn(directory);
    options.threadsPerProcess = 4;
    options.maximumProcesses = 1;
    PrivateStore store(options);
    store.addUser("alice", "word");
    store.start();
    const CurlClient alice(store, "alice", "word");
    ASSERT_EQ(alice.request("PUT", "/alice/x", {}, "x").status, 201);
    Stranger stranger(store.status().port);
    for (int i = 0; i < kStrangers; ++i) stranger.hold(GetParam());
    const auto began = std::chrono::steady_clock::now();
    EXPECT_EQ(alice.request("GET", "/alice/x").status, 200);
    const std::chrono::duration<double> waited = std::chrono::steady_clock::now() - began;
    EXPECT_LT(waited.count(), 15) << "seconds";
    std::printf("waited %.3f s\n", waited.count());
}

INSTANTIATE_TEST_SUITE_P(Each, SilentStrangers,
                         testing::Values(Silence::fromTheStart, Silence::afterOneByte, Silence::afterTheHandshake,
                                         Silence::withinARequest, Silence::afterTwoPieces, Silence::afterARefusal),
                         testing::PrintToStringParamName());

} // namespace
} // namespace rolvane
