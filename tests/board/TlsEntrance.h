#pragma once

#include <atomic>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

typedef struct ssl_ctx_st SSL_CTX;

namespace rolvane::board {

// A TLS server on a free loopback port that hands the bytes of each connection to a plain server on another port, and
// those that it answers back. When the plain server ends a connection it ends here at once, in the middle of an answer,
// too. A thread a connection.
class TlsEntrance {
public:
    // Certificate and key: PEM files.
    TlsEntrance(int plainPort, const std::string& certificate, const std::string& key);
    ~TlsEntrance();
    TlsEntrance(const TlsEntrance&) = delete;
    TlsEntrance& operator=(const TlsEntrance&) = delete;
    int port() const { return _port; }

private:
    void accept();
    void relay(int outside);

    const int _plainPort;
    SSL_CTX* _context = nullptr;
    int _listener = -1, _port = 0;
    std::atomic<bool> _ending = false;
    std::mutex _lock; // guards the following
    std::vector<std::thread> _threads;
    std::vector<int> _open;
    std::thread _acceptor;
};

} // namespace rolvane::board
