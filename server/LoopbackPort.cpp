#include "server/LoopbackPort.h"

#include "foundation/CXException.h"
#include "server/StoreProcess.h"

#include <arpa/inet.h>
#include <fstream>
#include <memory>
#include <netinet/in.h>
#include <openssl/err.h>
#include <openssl/ssl.h>
#include <random>
#include <string_view>
#include <sys/socket.h>
#include <sys/time.h>

namespace rolvane {

namespace {

FileHandle boundIPv4(int port) {
    FileHandle handle(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    const int yes = 1;
    setsockopt(handle.get(), SOL_SOCKET, SO_REUSEADDR, &yes, sizeof yes);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(static_cast<uint16_t>(port));
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    if (bind(handle.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) return FileHandle();
    return handle;
}

FileHandle boundIPv6(int port) {
    FileHandle handle(socket(AF_INET6, SOCK_STREAM | SOCK_CLOEXEC, 0));
    const int yes = 1;
    setsockopt(handle.get(), SOL_SOCKET, SO_REUSEADDR, &yes, sizeof yes);
    sockaddr_in6 address{};
    address.sin6_family = AF_INET6;
    address.sin6_port = htons(static_cast<uint16_t>(port));
    address.sin6_addr = in6addr_loopback;
    if (bind(handle.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) return FileHandle();
    return handle;
}

int firstOutgoingPort() {
    int first = 32768;
    std::ifstream("/proc/sys/net/ipv4/ip_local_port_range") >> first;
    return first;
}

bool answersInClear(int fd) {
    constexpr std::string_view request = "OPTIONS * HTTP/1.0\r\n\r\n";
    if (send(fd, request.data(), request.size(), MSG_NOSIGNAL) != static_cast<ssize_t>(request.size())) return false;
    char answer;
    return recv(fd, &answer, 1, 0) == 1;
}

// Nothing is sent over it, so whose certificate it is does not matter here.
bool shakesHands(int fd) {
    const std::unique_ptr<SSL_CTX, decltype(&SSL_CTX_free)> context(SSL_CTX_new(TLS_client_method()), &SSL_CTX_free);
    const std::unique_ptr<SSL, decltype(&SSL_free)> session(context ? SSL_new(context.get()) : nullptr, &SSL_free);
    const bool good = session && SSL_set_fd(session.get(), fd) == 1 && SSL_connect(session.get()) == 1;
    if (good) SSL_shutdown(session.get());
    ERR_clear_error();
    return good;
}

} // namespace

bool LoopbackPort::hasIPv6() {
    return static_cast<bool>(boundIPv6(0));
}

bool LoopbackPort::isFree(int port) {
    return boundIPv4(port) && (!hasIPv6() || boundIPv6(port));
}

int LoopbackPort::choose() {
    const int last = firstOutgoingPort() > 12000 ? firstOutgoingPort() - 1 : 65535;
    std::random_device random;
    std::uniform_int_distribution<int> any(10240, last);
    for (int attempt = 0; attempt < 200; ++attempt) {
        const int port = any(random);
        if (isFree(port)) return port;
    }
    throw CXException(
        "CXPrivateStoreException",
        "No free port was found on this machine's loopback address. Choose one for the store with --port.");
}

bool LoopbackPort::answers(int port, bool tls, std::chrono::seconds timeout) {
    FileHandle handle(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    const timeval limit{timeout.count(), 0};
    setsockopt(handle.get(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(static_cast<uint16_t>(port));
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    if (connect(handle.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) return false;
    return tls ? shakesHands(handle.get()) : answersInClear(handle.get());
}

} // namespace rolvane
