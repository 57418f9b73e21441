#include "store/HttpTransport.h"
#include "support/TempHome.h"

#include <arpa/inet.h>
#include <atomic>
#include <fcntl.h>
#include <fstream>
#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <openssl/x509v3.h>
#include <sys/socket.h>
#include <thread>
#include <unistd.h>

namespace rolvane {
namespace {

using test::TempDirectory;

template <class T, void (*release)(T*)>
struct Releaser {
    void operator()(T* it) const { release(it); }
};
template <class T, void (*release)(T*)>
using Owned = std::unique_ptr<T, Releaser<T, release>>;

// One connection of HTTP/2 over TLS (RFC 9113) that sends the whole body of the first answer at once, and the end of
// that stream only when another request arrives.
class ForgetfulServer {
public:
    explicit ForgetfulServer(const std::string& caFile) : _context(SSL_CTX_new(TLS_server_method())) {
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
        if (::bind(_listener, reinterpret_cast<sockaddr*>(&any), size) != 0 || ::listen(_listener, 1) != 0 ||
            ::getsockname(_listener, reinterpret_cast<sockaddr*>(&any), &size) != 0)
            throw std::runtime_error("no port to listen on");
        port = ntohs(any.sin_port);
        _thread = std::thread([this] { serve(); });
    }
    ~ForgetfulServer() {
        ::shutdown(_listener, SHUT_RDWR);
        _thread.join();
        ::close(_listener);
    }
    ForgetfulServer(const ForgetfulServer&) = delete;
    ForgetfulServer& operator=(const ForgetfulServer&) = delete;

    int port = 0;
    std::atomic<int> requests{0};

private:
    enum Type : uint8_t { data = 0, headers = 1, settings = 4 };
    enum Flag : uint8_t { none = 0, endStream = 1, acknowledged = 1, endHeaders = 4 };

    void certify(const std::string& caFile) {
        const Owned<EVP_PKEY, EVP_PKEY_free> key(EVP_EC_gen("P-256"));
        const Owned<X509, X509_free> own(X509_new());
        X509_set_version(own.get(), 2);
        ASN1_INTEGER_set(X509_get_serialNumber(own.get()), 1);
        X509_gmtime_adj(X509_getm_notBefore(own.get()), -3600);
        X509_gmtime_adj(X509_getm_notAfter(own.get()), 3600);
        X509_set_pubkey(own.get(), key.get());
        X509_NAME* name = X509_get_subject_name(own.get());
        X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_ASC, reinterpret_cast<const unsigned char*>("localhost"), -1,
                                   -1, 0);
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

    bool receive(SSL* tls, std::string& bytes, size_t size) {
        bytes.resize(size);
        for (size_t got = 0; got < size;) {
            const int n = SSL_read(tls, bytes.data() + got, static_cast<int>(size - got));
            if (n <= 0) return false;
            got += static_cast<size_t>(n);
        }
        return true;
    }
    void send(SSL* tls, Type type, uint8_t flags, uint32_t stream, const std::string& content) {
        const auto size = static_cast<uint32_t>(content.size());
        std::string frame;
        for (const uint32_t part : {size >> 16, size >> 8, size, uint32_t{type}, uint32_t{flags}, stream >> 24,
                                    stream >> 16, stream >> 8, stream})
            frame += static_cast<char>(part & 0xff);
        frame += content;
        SSL_write(tls, frame.data(), static_cast<int>(frame.size()));
    }

    void serve() {
        const int socket = ::accept4(_listener, nullptr, nullptr, SOCK_CLOEXEC);
        if (socket < 0) return;
        const Owned<SSL, SSL_free> tls(SSL_new(_context.get()));
        SSL_set_fd(tls.get(), socket);
        std::string bytes;
        if (SSL_accept(tls.get()) == 1 && receive(tls.get(), bytes, 24)) { // the client's preface
            send(tls.get(), settings, none, 0, "");
            while (receive(tls.get(), bytes, 9)) answer(tls.get(), bytes);
        }
        ::close(socket);
    }
    void answer(SSL* tls, const std::string& head) {
        const auto at = [&](size_t i) { return static_cast<uint32_t>(static_cast<uint8_t>(head[i])); };
        std::string content;
        const size_t size = (at(0) << 16) + (at(1) << 8) + at(2);
        if (size > 0 && !receive(tls, content, size)) return;
        const uint32_t stream = (at(5) << 24) + (at(6) << 16) + (at(7) << 8) + at(8);
        if (at(3) == settings && at(4) == none) send(tls, settings, acknowledged, 0, "");
        if (at(3) != headers) return;
        const std::string ok = "\x88"; // :status 200 (RFC 7541, appendix A)
        if (++requests == 1) {
            _first = stream;
            send(tls, headers, endHeaders, stream, ok);
            send(tls, data, none, stream, "the whole body");
            return;
        }
        send(tls, headers, endHeaders | endStream, stream, ok);
        send(tls, data, endStream, _first, "");
    }

    const Owned<SSL_CTX, SSL_CTX_free> _context;
    const int _listener = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    uint32_t _first = 0;
    std::thread _thread;
};

TEST(StillStream, WhoseEndTheServerForgetsIsEndedByASmallRequestOfOurOwn) {
    const TempDirectory directory;
    ForgetfulServer server(directory / "ca.pem");
    HttpResponse answer;
    {
        CurlTransportOptions options;
        options.caFile = directory / "ca.pem";

        CurlTransport transport(options);
        HttpRequest request;
        request.method = "GET";
        request.url = Url("https://localhost:" + std::to_string(server.port) + "/listing");
        request.limits.idleSeconds = 20;
        answer = transport.perform(std::move(request));
    }
    EXPECT_EQ(answer.status, 200) << answer.detail;
    EXPECT_EQ(answer.body, "the whole body");
    EXPECT_EQ(server.requests, 2);
}

} // namespace
} // namespace rolvane
