#include "TlsEntrance.h"

#include "foundation/CXException.h"

#include <algorithm>
#include <arpa/inet.h>
#include <csignal>
#include <netinet/in.h>
#include <openssl/ssl.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

namespace rolvane::board {

namespace {

sockaddr_in loopback(int port) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    address.sin_port = htons(static_cast<uint16_t>(port));
    return address;
}

bool sendAll(int fd, const char* bytes, size_t size) {
    for (size_t sent = 0; sent < size;) {
        const ssize_t n = ::send(fd, bytes + sent, size - sent, MSG_NOSIGNAL);
        if (n <= 0) return false;
        sent += static_cast<size_t>(n);
    }
    return true;
}

// Until one side ends.
void pump(SSL* ssl, int outside, int inside) {
    char bytes[16384];
    for (;;) {
        pollfd ready[2] = {{outside, POLLIN, 0}, {inside, POLLIN, 0}};
        if (SSL_pending(ssl) == 0 && ::poll(ready, 2, -1) < 0) return;
        if (SSL_pending(ssl) > 0 || ready[0].revents != 0) {
            const int n = SSL_read(ssl, bytes, sizeof bytes);
            if (n <= 0 || !sendAll(inside, bytes, static_cast<size_t>(n))) return;
        }
        if (ready[1].revents != 0) {
            const ssize_t n = ::recv(inside, bytes, sizeof bytes, 0);
            if (n <= 0 || SSL_write(ssl, bytes, static_cast<int>(n)) <= 0) return;
        }
    }
}

} // namespace

TlsEntrance::TlsEntrance(int plainPort, const std::string& certificate, const std::string& key)
    : _plainPort(plainPort), _context(SSL_CTX_new(TLS_server_method())) {
    sockaddr_in address = loopback(0);
    socklen_t length = sizeof address;
    _listener = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    const bool good = SSL_CTX_use_certificate_chain_file(_context, certificate.c_str()) == 1 &&
                      SSL_CTX_use_PrivateKey_file(_context, key.c_str(), SSL_FILETYPE_PEM) == 1 &&
                      ::bind(_listener, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0 &&
                      ::listen(_listener, SOMAXCONN) == 0 &&
                      ::getsockname(_listener, reinterpret_cast<sockaddr*>(&address), &length) == 0;
    if (!good) throw CXException("CXBoardException", "no entrance to the store");
    _port = ntohs(address.sin_port);
    _acceptor = std::thread([this] { accept(); });
}

TlsEntrance::~TlsEntrance() {
    _ending = true;
    ::shutdown(_listener, SHUT_RDWR);
    _acceptor.join();
    ::close(_listener);
    std::vector<std::thread> threads;
    {
        const std::lock_guard guard(_lock);
        for (const int fd : _open) ::shutdown(fd, SHUT_RDWR);
        threads.swap(_threads);
    }
    for (std::thread& each : threads) each.join();
    SSL_CTX_free(_context);
}

void TlsEntrance::accept() {
    sigset_t pipes; // a client that was killed; this thread's connections have the mask, too
    sigemptyset(&pipes);
    sigaddset(&pipes, SIGPIPE);
    ::pthread_sigmask(SIG_BLOCK, &pipes, nullptr);
    while (!_ending) {
        const int fd = ::accept4(_listener, nullptr, nullptr, SOCK_CLOEXEC);
        if (fd < 0) return;
        const std::lock_guard guard(_lock);
        if (_ending) {
            ::close(fd);
            return;
        }
        _open.push_back(fd);
        _threads.emplace_back([this, fd] { relay(fd); });
    }
}

void TlsEntrance::relay(int outside) {
    const int inside = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    const sockaddr_in address = loopback(_plainPort);
    SSL* ssl = SSL_new(_context);
    SSL_set_fd(ssl, outside);
    if (::connect(inside, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0 && SSL_accept(ssl) == 1)
        pump(ssl, outside, inside);
    SSL_free(ssl);
    const std::lock_guard guard(_lock);
    _open.erase(std::find(_open.begin(), _open.end(), outside));
    ::close(outside);
    ::close(inside);
}

} // namespace rolvane::board
