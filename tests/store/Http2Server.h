#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <openssl/ssl.h>
#include <string>
#include <thread>
#include <vector>

namespace rolvane::test {

// HTTP/2 over TLS on a free loopback port (RFC 9113), for what no proper server does: a script sends the frames. It
// answers as "localhost" with a certificate of its own. A thread a connection; the script may be called from several.
class Http2Server {
public:
    enum Type : uint8_t { data = 0, headers = 1, reset = 3, settings = 4, goAway = 7 };
    enum Flag : uint8_t { none = 0, endStream = 1, acknowledged = 1, endHeaders = 4 };
    enum Error : uint32_t { noError = 0, refusedStream = 7 };

    // A connection as the script sees it.
    struct Connection {
        SSL* tls;
        int number; // counted from 1
        int requests = 0;
        bool closes = false; // set by the script: the connection ends now, without another word

        void send(Type type, uint8_t flags, uint32_t stream, const std::string& content = {}) const;
        void sendOk(uint32_t stream) const; // status 200 without a body
        void sendReset(uint32_t stream, Error error) const;
        void sendGoAway(uint32_t lastStream, Error error) const;
    };
    // Called with each request, when its header has come.
    using Script = std::function<void(Connection&, uint32_t stream)>;

    Http2Server(const std::string& caFile, Script script); // `caFile`: where the certificate is written
    ~Http2Server();
    Http2Server(const Http2Server&) = delete;
    Http2Server& operator=(const Http2Server&) = delete;

    std::string origin() const { return "https://localhost:" + std::to_string(_port); }
    int connections() const { return _connections; }
    int requests() const { return _requests; }

private:
    void certify(const std::string& caFile);
    void accept();
    void serve(int socket, int number);

    const Script _script;
    const std::unique_ptr<SSL_CTX, void (*)(SSL_CTX*)> _context;
    const int _listener;
    int _port = 0;
    std::atomic<int> _connections{0}, _requests{0};
    std::mutex _mutex; // guards the following
    std::vector<std::thread> _threads;
    std::vector<int> _open;
    std::thread _acceptor;
};

} // namespace rolvane::test
