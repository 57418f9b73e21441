#include "Http2Server.h"

#include <arpa/inet.h>
#include <csignal>
#include <cstdio>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>
#include <stdexcept>
#include <sys/socket.h>
#include <unistd.h>

namespace rolvane::test {

namespace {

template <class T, void (*release)(T*)>
struct Releaser {
    void operator()(T* it) const { release(it); }
};
template <class T, void (*release)(T*)>
using Owned = std::unique_ptr<T, Releaser<T, release>>;

std::string bigEndian(uint32_t number) {
    std::string bytes;
    for (const int shift : {24, 16, 8, 0}) bytes += static_cast<char>((number >> shift) & 0xff);
    return bytes;
}

bool receive(SSL* tls, std::string& bytes, size_t size) {
    bytes.resize(size);
    for (size_t got = 0; got < size;) {
        const int n = SSL_read(tls, bytes.data() + got, static_cast<int>(size - got));
        if (n <= 0) return false;
        got += static_cast<size_t>(n);
    }
    return true;
}

struct Frame {
    uint32_t type = 0, flags = 0, stream = 0;
};

bool receive(SSL* tls, Frame& frame) {
    std::string head, content;
    if (!receive(tls, head, 9)) return false;
    const auto at = [&](size_t i) { return static_cast<uint32_t>(static_cast<uint8_t>(head[i])); };
    frame = {at(3), at(4), (at(5) << 24) + (at(6) << 16) + (at(7) << 8) + at(8)};
    const size_t size = (at(0) << 16) + (at(1) << 8) + at(2);
    return size == 0 || receive(tls, content, size);
}

} // namespace

void Http2Server::Connection::send(Type type, uint8_t flags, uint32_t stream, const std::string& content) const {
    const auto size = static_cast<uint32_t>(content.size());
    const std::string frame =
        bigEndian(size).substr(1) + static_cast<char>(type) + static_cast<char>(flags) + bigEndian(stream) + content;
    SSL_write(tls, frame.data(), static_cast<int>(frame.size()));
}

void Http2Server::Connection::sendOk(uint32_t stream) const {
    send(headers, endHeaders | endStream, stream, "\x88"); // :status 200 (RFC 7541, appendix A)
}

void Http2Server::Connection::sendReset(uint32_t stream, Error error) const {
    send(reset, none, stream, bigEndian(error));
}

void Http2Server::Connection::sendGoAway(uint32_t lastStream, Error error) const {
    send(goAway, none, 0, bigEndian(lastStream) + bigEndian(error));
}

Http2Server::Http2Server(const std::string& caFile, Script script)
    : _script(std::move(script)), _context(SSL_CTX_new(TLS_server_method()), &SSL_CTX_free),
      _listener(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    ::signal(SIGPIPE, SIG_IGN); // a client that has gone ends no test
    certify(caFile);
    SSL_CTX_set_alpn_select_cb(
        _context.get(),
        [](SSL*, const unsigned char** chosen, unsigned char* length, const unsigned char*, unsigned, void*) {
            *chosen = reinterpret_cast<const unsigned char*>("h2");
            *length = 2;
            return SSL_TLSEXT_ERR_OK;
        },
        nullptr);
    sockaddr_in any{};
    any.sin_family = AF_INET;
    any.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t size = sizeof any;
    if (::bind(_listener, reinterpret_cast<sockaddr*>(&any), size) != 0 || ::listen(_listener, 16) != 0 ||
        ::getsockname(_listener, reinterpret_cast<sockaddr*>(&any), &size) != 0)
        throw std::runtime_error("no port to listen on");
    _port = ntohs(any.sin_port);
    _acceptor = std::thread([this] { accept(); });
}

Http2Server::~Http2Server() {
    ::shutdown(_listener, SHUT_RDWR);
    _acceptor.join();
    ::close(_listener);
    std::vector<std::thread> threads;
    {
        const std::lock_guard guard(_mutex);
        for (const int socket : _open) ::shutdown(socket, SHUT_RDWR);
        threads.swap(_threads);
    }
    for (auto& thread : threads) thread.join();
}

void Http2Server::certify(const std::string& caFile) {
    const Owned<EVP_PKEY, EVP_PKEY_free> key(EVP_EC_gen("P-256"));
    const Owned<X509, X509_free> own(X509_new());
    X509_set_version(own.get(), 2);
    ASN1_INTEGER_set(X509_get_serialNumber(own.get()), 1);
    X509_gmtime_adj(X509_getm_notBefore(own.get()), -3600);
    X509_gmtime_adj(X509_getm_notAfter(own.get()), 3600);
    X509_set_pubkey(own.get(), key.get());
    X509_NAME* name = X509_get_subject_name(own.get());
    X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_ASC, reinterpret_cast<const unsigned char*>("localhost"), -1, -1,
                               0);
    X509_set_issuer_name(own.get(), name);
    for (const auto& [kind, text] :
         {std::pair(NID_basic_constraints, "critical,CA:TRUE"), std::pair(NID_subject_alt_name, "DNS:localhost")}) {
        X509_EXTENSION* extension = X509V3_EXT_conf_nid(nullptr, nullptr, kind, text);
        X509_add_ext(own.get(), extension, -1);
        X509_EXTENSION_free(extension);
    }
    X509_sign(own.get(), key.get(), EVP_sha256());
    FILE* file = ::fopen(caFile.c_str(), "w");
    PEM_write_X509(file, own.get());
    ::fclose(file);
    SSL_CTX_use_certificate(_context.get(), own.get());
    SSL_CTX_use_PrivateKey(_context.get(), key.get());
}

void Http2Server::accept() {
    for (;;) {
        const int socket = ::accept4(_listener, nullptr, nullptr, SOCK_CLOEXEC);
        if (socket < 0) return;
        const std::lock_guard guard(_mutex);
        _open.push_back(socket);
        _threads.emplace_back([this, socket, number = ++_connections] { serve(socket, number); });
    }
}

void Http2Server::serve(int socket, int number) {
    {
        const Owned<SSL, SSL_free> tls(SSL_new(_context.get()));
        SSL_set_fd(tls.get(), socket);
        Connection connection{tls.get(), number};
        std::string preface;
        if (SSL_accept(tls.get()) == 1 && receive(tls.get(), preface, 24)) {
            connection.send(settings, none, 0);
            for (Frame frame; !connection.closes && receive(tls.get(), frame);) {
                if (frame.type == settings && frame.flags == none) connection.send(settings, acknowledged, 0);
                if (frame.type != headers) continue;
                ++connection.requests;
                ++_requests;
                _script(connection, frame.stream);
            }
        }
    }
    const std::lock_guard guard(_mutex);
    std::erase(_open, socket);
    ::close(socket);
}

} // namespace rolvane::test
