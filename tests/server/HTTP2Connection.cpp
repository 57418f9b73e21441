#include "HTTP2Connection.h"

#include "foundation/Base64.h"

#include <stdexcept>

namespace rolvane {
namespace {

constexpr uint8_t kPing = 6, kAcknowledged = 1, kEndHeaders = 4;

void appendNumber(std::string& text, uint32_t number, int bytes) {
    for (int i = bytes - 1; i >= 0; --i) text += static_cast<char>(number >> (8 * i) & 0xff);
}

// A length with a prefix of seven bits (RFC 7541 section 5.1), and the text as it is.
void appendText(std::string& block, const std::string& text) {
    size_t length = text.size();
    constexpr size_t kPrefix = 127;
    if (length < kPrefix) {
        block += static_cast<char>(length);
    } else {
        block += static_cast<char>(kPrefix);
        for (length -= kPrefix; length >= 128; length /= 128) block += static_cast<char>(length % 128 + 128);
        block += static_cast<char>(length);
    }
    block += text;
}

} // namespace

HTTP2Connection::HTTP2Connection(int port, uint32_t window) : tls(port, "h2") {
    constexpr uint32_t kInitialWindow = 4;
    std::string settings;
    appendNumber(settings, kInitialWindow, 2);
    appendNumber(settings, window, 4);
    tls.write("PRI * HTTP/2.0\r\n\r\nSM\r\n\r\n");
    send({kSettings, 0, 0, settings});
}

void HTTP2Connection::send(const Frame& frame) {
    std::string text;
    appendNumber(text, static_cast<uint32_t>(frame.payload.size()), 3);
    text += static_cast<char>(frame.type);
    text += static_cast<char>(frame.flags);
    appendNumber(text, frame.stream, 4);
    tls.write(text + frame.payload);
}

uint32_t HTTP2Connection::request(const std::string& user, const std::string& method, const std::string& path,
                                  const Headers& headers, bool hasBody) {
    Headers all = {{":method", method}, {":scheme", "https"}, {":authority", "localhost"}, {":path", path}};
    if (!user.empty()) {
        const std::string words = user + ":word";
        std::string value = "Basic ";
        appendBase64(reinterpret_cast<const uint8_t*>(words.data()), words.size(), value);
        all.emplace_back("authorization", value);
    }
    all.insert(all.end(), headers.begin(), headers.end());
    std::string block;
    for (const auto& [name, value] : all) {
        block += '\0'; // literal, not remembered
        appendText(block, name);
        appendText(block, value);
    }
    _last = _last ? _last + 2 : 1;
    send({kHeaders, static_cast<uint8_t>(kEndHeaders | (hasBody ? 0 : kEndStream)), _last, block});
    return _last;
}

void HTTP2Connection::data(uint32_t stream, const std::string& bytes, bool isLast) {
    send({kData, static_cast<uint8_t>(isLast ? kEndStream : 0), stream, bytes});
}

HTTP2Connection::Frame HTTP2Connection::next() {
    constexpr size_t kHead = 9;
    for (;;) {
        const std::string head = tls.read(kHead);
        if (head.size() < kHead) return {};
        const auto byte = [&](size_t i) { return static_cast<uint32_t>(static_cast<unsigned char>(head[i])); };
        Frame frame;
        frame.type = static_cast<uint8_t>(byte(3));
        frame.flags = static_cast<uint8_t>(byte(4));
        frame.stream = (byte(5) << 24 | byte(6) << 16 | byte(7) << 8 | byte(8)) & 0x7fffffff;
        frame.payload = tls.read(byte(0) << 16 | byte(1) << 8 | byte(2));
        if (frame.type == kSettings || frame.type == kPing) {
            if (!(frame.flags & kAcknowledged))
                send({frame.type, kAcknowledged, 0, frame.type == kPing ? frame.payload : ""});
            continue;
        }
        return frame;
    }
}

std::string HTTP2Connection::headersOf(uint32_t stream) {
    for (Frame frame = next(); frame.type != 0xff; frame = next())
        if (frame.type == kHeaders && frame.stream == stream) return frame.payload;
    return {};
}

} // namespace rolvane
