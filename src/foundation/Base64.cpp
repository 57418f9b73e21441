#include "foundation/Base64.h"

#include <array>

namespace rolvane {

namespace {

constexpr std::string_view kAlphabet = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
constexpr int8_t kOther = -1, kSpace = -2, kPadding = -3;

constexpr std::array<int8_t, 256> kValues = [] {
    std::array<int8_t, 256> values{};
    values.fill(kOther);
    for (size_t i = 0; i < kAlphabet.size(); ++i)
        values[static_cast<unsigned char>(kAlphabet[i])] = static_cast<int8_t>(i);
    for (const char c : {' ', '\t', '\n', '\r'}) values[static_cast<unsigned char>(c)] = kSpace;
    values['='] = kPadding;
    return values;
}();

} // namespace

void appendBase64(const uint8_t* data, size_t size, std::string& out) {
    size_t i = 0;
    for (; i + 3 <= size; i += 3) {
        const uint32_t n = static_cast<uint32_t>(data[i] << 16 | data[i + 1] << 8 | data[i + 2]);
        const char four[] = {kAlphabet[n >> 18], kAlphabet[n >> 12 & 63], kAlphabet[n >> 6 & 63], kAlphabet[n & 63]};
        out.append(four, 4);
    }
    if (i == size) return;
    const bool two = i + 2 == size;
    const uint32_t n = static_cast<uint32_t>(data[i] << 16 | (two ? data[i + 1] << 8 : 0));
    out += kAlphabet[n >> 18];
    out += kAlphabet[n >> 12 & 63];
    out += two ? kAlphabet[n >> 6 & 63] : '=';
    out += '=';
}

std::optional<Bytes> fromBase64(std::string_view text) {
    Bytes out;
    out.reserve(text.size() / 4 * 3 + 3);
    uint32_t bits = 0;
    size_t digits = 0, padding = 0;
    for (const char c : text) {
        const int8_t v = kValues[static_cast<unsigned char>(c)];
        if (v == kSpace) continue;
        if (v == kPadding) {
            ++padding;
            continue;
        }
        if (v == kOther || padding > 0) return std::nullopt;
        bits = bits << 6 | static_cast<uint32_t>(v);
        if (++digits % 4 != 0) continue;
        out.push_back(static_cast<uint8_t>(bits >> 16));
        out.push_back(static_cast<uint8_t>(bits >> 8));
        out.push_back(static_cast<uint8_t>(bits));
    }
    const size_t rest = digits % 4;
    if (rest == 1 || (padding > 0 && (rest == 0 || rest + padding != 4))) return std::nullopt;
    if (rest == 2) out.push_back(static_cast<uint8_t>(bits >> 4));
    if (rest == 3) {
        out.push_back(static_cast<uint8_t>(bits >> 10));
        out.push_back(static_cast<uint8_t>(bits >> 2));
    }
    return out;
}

} // namespace rolvane
