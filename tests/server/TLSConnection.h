#pragma once

#include <openssl/ssl.h>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

// A TLS connection to the store at a loopback port, whose bytes a test writes and reads itself. Nobody's certificate is
// looked at. Throws std::runtime_error when there is no connection, or when it takes no more.
class TLSConnection {
public:
    // `protocol` is the one that is asked for by ALPN, "h2" for instance; "" asks for none.
    explicit TLSConnection(int port, std::string_view protocol = {});
    ~TLSConnection();
    TLSConnection(const TLSConnection&) = delete;
    TLSConnection& operator=(const TLSConnection&) = delete;

    void write(std::string_view piece);
    // What has come, at least one byte; "" at the end, or when nothing has come for 20 seconds.
    std::string read();
    // Exactly so many bytes; fewer at the end.
    std::string read(size_t count);
    // The statuses of so many answers (HTTP/1.1), fewer when they do not come.
    std::vector<int> answers(size_t count);

    // Reads and writes give up after so many seconds instead of 20.
    void setPatience(int seconds);

private:
    SSL_CTX* _context;
    SSL* _session;
    int _socket;
};

} // namespace rolvane
