#pragma once

#include "server/PrivateStore.h"

#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace rolvane {

struct RawAnswer {
    int status = 0; // 0: no answer
    std::string headers, body;
    // The name of the DAV:error's child, "" when there is none.
    std::string precondition() const;
};

// One plain HTTP/1.1 request on a connection of its own, byte for byte as given: no client library cleans the path up.
// The path is the whole one ("/dav/alice/"). Basic authentication unless the user is "".
struct RawRequest {
    std::string user, method, path;
    std::vector<std::pair<std::string, std::string>> headers = {};
    std::string body = {};
};
RawAnswer rawRequest(int port, const RawRequest& request);
// Digest authentication (RFC 7616 with MD5 and qop "auth"): the nonce of a 401, and the value of the header
// Authorization.
std::string nonceIn(const RawAnswer& answer);
std::string rawDigest(const std::string& user, const RawRequest& request, const std::string& nonce);
std::string rawPasswordOf(const std::string& user);

// A request of which the head and some of the body are sent, and the rest when asked.
class RawUpload {
public:
    RawUpload(int port, const RawRequest& request, size_t firstBytes);
    ~RawUpload();
    RawUpload(const RawUpload&) = delete;
    // Until the server asks for the body of a request with "Expect: 100-continue": it is in the middle of handling it.
    bool awaitContinue();
    RawAnswer finish();

private:
    int _socket;
    std::string _rest;
};

// A request whose answer comes in lines for as long as the server likes.
class RawLines {
public:
    RawLines(int port, const RawRequest& request);
    ~RawLines();
    RawLines(const RawLines&) = delete;
    int status(); // 0: no answer
    // Waits for the next line; nothing when the answer has ended, or nothing came for 60 seconds.
    std::optional<std::string> line();
    bool hasEnded() const { return _ended; } // properly, as chunked answers do

private:
    bool receive();
    bool receiveUntil(const std::string& mark);
    int _socket;
    int _status = -1;
    bool _ended = false;
    std::string _raw, _text; // not looked at yet: as it came, and without the chunks' marks
};

} // namespace rolvane
