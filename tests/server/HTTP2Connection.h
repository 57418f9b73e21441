#pragma once

#include "TLSConnection.h"

#include <cstdint>
#include <utility>

namespace rolvane {

// HTTP/2 (RFC 9113) to the private store, frame by frame, for clients that no library would be.
class HTTP2Connection {
public:
    using Headers = std::vector<std::pair<std::string, std::string>>;
    struct Frame {
        uint8_t type = 0xff, flags = 0; // type 0xff: there is no further frame
        uint32_t stream = 0;
        std::string payload;
    };
    static constexpr uint8_t kData = 0, kHeaders = 1, kReset = 3, kSettings = 4, kGoAway = 7, kEndStream = 1;

    // Answers may have so many bytes of content in each stream before the client takes them (flow control).
    HTTP2Connection(int port, uint32_t window);

    // Begins a request as the user whose password is "word"; its number. With `hasBody` it does not end here.
    uint32_t request(const std::string& user, const std::string& method, const std::string& path,
                     const Headers& headers = {}, bool hasBody = false);
    void data(uint32_t stream, const std::string& bytes, bool isLast);
    void send(const Frame& frame);
    Frame next(); // settings and pings are answered and not told
    // Waits for the headers of the stream's answer, and for nothing else: their bytes, "" when none come.
    std::string headersOf(uint32_t stream);

    TLSConnection tls;

private:
    uint32_t _last = 0;
};

} // namespace rolvane
