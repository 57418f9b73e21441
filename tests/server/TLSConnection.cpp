#include "TLSConnection.h"

#include <arpa/inet.h>
#include <cstdlib>
#include <netinet/in.h>
#include <stdexcept>
#include <sys/socket.h>
#include <unistd.h>

namespace rolvane {

TLSConnection::TLSConnection(int port, std::string_view protocol)
    : _context(SSL_CTX_new(TLS_client_method())), _session(SSL_new(_context)),
      _socket(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(static_cast<uint16_t>(port));
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    constexpr int kPatience = 20;
    setPatience(kPatience);
    if (!protocol.empty()) {
        const std::string names = static_cast<char>(protocol.size()) + std::string(protocol);
        SSL_set_alpn_protos(_session, reinterpret_cast<const unsigned char*>(names.data()),
                            static_cast<unsigned>(names.size()));
    }
    SSL_set_fd(_session, _socket);
    if (connect(_socket, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 || SSL_connect(_session) != 1)
        throw std::runtime_error("no connection to the store");
}

void TLSConnection::setPatience(int seconds) {
    const timeval patience{seconds, 0};
    setsockopt(_socket, SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
    setsockopt(_socket, SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
}

TLSConnection::~TLSConnection() {
    SSL_free(_session);
    SSL_CTX_free(_context);
    close(_socket);
}

void TLSConnection::write(std::string_view piece) {
    if (SSL_write(_session, piece.data(), static_cast<int>(piece.size())) <= 0)
        throw std::runtime_error("the store takes no more");
}

std::string TLSConnection::read() {
    char bytes[16384];
    const int count = SSL_read(_session, bytes, sizeof bytes);
    return {bytes, static_cast<size_t>(count > 0 ? count : 0)};
}

std::string TLSConnection::read(size_t count) {
    std::string text(count, '\0');
    size_t have = 0;
    for (int n; have < count && (n = SSL_read(_session, text.data() + have, static_cast<int>(count - have))) > 0;)
        have += static_cast<size_t>(n);
    text.resize(have);
    return text;
}

std::vector<int> TLSConnection::answers(size_t count) {
    const std::string begin = "HTTP/1.1 ";
    std::vector<int> all;
    std::string text;
    while (all.size() < count) {
        const std::string more = read();
        if (more.empty()) break;
        text += more;
        all.clear();
        for (size_t at = 0; (at = text.find(begin, at)) != std::string::npos; at += begin.size())
            all.push_back(std::atoi(text.c_str() + at + begin.size()));
    }
    return all;
}

} // namespace rolvane
