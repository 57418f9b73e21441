#pragma once

#include <atomic>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace rolvane::test {

// What the fake server was asked. Header names are in lower case.
struct FakeRequest {
    std::string method, target, body;
    std::map<std::string, std::string> headers;
    int connection = 0; // counted from 1
};

// What it sends: the bytes as they stand, in pieces with a pause before each.
struct FakeAnswer {
    struct Piece {
        double pauseSeconds = 0;
        std::string bytes;
    };
    std::vector<Piece> pieces;
    bool closes = false;  // closes the connection after the last piece
    bool forever = false; // repeats the last piece until the client goes away
    bool silent = false;  // sends nothing and keeps the connection open

    static FakeAnswer status(int status, const std::string& body = {}, const std::string& headers = {});
    static FakeAnswer raw(std::string bytes, bool closes = true) {
        return {{{0, std::move(bytes)}}, closes, false, false};
    }
};

// An HTTP/1.1 server on a free loopback port that answers by script over real sockets, for what a proper server never
// does. A thread a connection; the script may be called from several at once.
class FakeHttpServer {
public:
    using Script = std::function<FakeAnswer(const FakeRequest&)>;
    explicit FakeHttpServer(Script script);
    ~FakeHttpServer();
    FakeHttpServer(const FakeHttpServer&) = delete;
    FakeHttpServer& operator=(const FakeHttpServer&) = delete;

    int port() const { return _port; }
    std::string origin() const { return "http://127.0.0.1:" + std::to_string(_port); }
    std::vector<FakeRequest> requests() const; // all so far, in order of arrival
    int connections() const { return _connections; }
    // Closes every connection that stands, as a server does with those that nobody used for a while.
    void closeConnections();

private:
    void accept();
    void serve(int fd, int number);
    bool answer(int fd, const FakeAnswer& answer);
    bool pause(double seconds) const; // false when the server is ending

    const Script _script;
    int _listener = -1, _port = 0;
    std::atomic<bool> _ending{false};
    std::atomic<int> _connections{0};
    mutable std::mutex _mutex; // guards the following
    std::vector<FakeRequest> _requests;
    std::vector<std::thread> _threads;
    std::vector<int> _open;
    std::thread _acceptor;
};

} // namespace rolvane::test
