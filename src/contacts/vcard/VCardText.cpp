#include "contacts/vcard/VCardText.h"

#include <array>
#include <cerrno>
#include <cstring>
#include <iconv.h>

namespace rolvane {

namespace {

// Length of the well-formed sequence that starts at i, 0 when there is none (Unicode table 3-7).
size_t sequenceLength(std::string_view t, size_t i) {
    auto at = [&](size_t k) { return k < t.size() ? static_cast<uint8_t>(t[k]) : 0; };
    auto tail = [&](size_t k) { return (at(k) & 0xC0) == 0x80; };
    uint8_t a = at(i), b = at(i + 1);
    if (a < 0x80) return 1;
    if (a >= 0xC2 && a <= 0xDF) return tail(i + 1) ? 2 : 0;
    if (a >= 0xE0 && a <= 0xEF) {
        uint8_t low = a == 0xE0 ? 0xA0 : 0x80, high = a == 0xED ? 0x9F : 0xBF;
        return b >= low && b <= high && tail(i + 2) ? 3 : 0;
    }
    if (a >= 0xF0 && a <= 0xF4) {
        uint8_t low = a == 0xF0 ? 0x90 : 0x80, high = a == 0xF4 ? 0x8F : 0xBF;
        return b >= low && b <= high && tail(i + 2) && tail(i + 3) ? 4 : 0;
    }
    return 0;
}

constexpr std::array<int8_t, 256> base64Table() {
    std::array<int8_t, 256> t{};
    for (auto& v : t) v = -1;
    const char* digits = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    for (int i = 0; i < 64; i++) t[static_cast<uint8_t>(digits[i])] = static_cast<int8_t>(i);
    return t;
}

int hexDigit(char c) {
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    return -1;
}

std::string decodeHex(std::string_view text, char mark) {
    std::string out;
    out.reserve(text.size());
    for (size_t i = 0; i < text.size(); i++) {
        if (text[i] == mark && i + 2 < text.size() && hexDigit(text[i + 1]) >= 0 && hexDigit(text[i + 2]) >= 0) {
            out += static_cast<char>(hexDigit(text[i + 1]) * 16 + hexDigit(text[i + 2]));
            i += 2;
        } else {
            out += text[i];
        }
    }
    return out;
}

struct Converter {
    iconv_t handle;
    explicit Converter(const char* from) : handle(iconv_open("UTF-8", from)) {}
    ~Converter() {
        if (valid()) iconv_close(handle);
    }
    Converter(const Converter&) = delete;
    Converter& operator=(const Converter&) = delete;
    bool valid() const { return handle != reinterpret_cast<iconv_t>(-1); }
};

} // namespace

std::optional<size_t> vcardFirstInvalidUTF8(std::string_view text) {
    size_t i = 0;
    while (i < text.size()) {
        uint64_t word;
        if (i + 8 <= text.size() && (std::memcpy(&word, text.data() + i, 8), (word & 0x8080808080808080ULL) == 0)) {
            i += 8;
            continue;
        }
        size_t n = sequenceLength(text, i);
        if (n == 0) return i;
        i += n;
    }
    return std::nullopt;
}

bool vcardHasControlCharacter(std::string_view text) {
    for (size_t i = 0; i < text.size(); i++) {
        auto c = static_cast<uint8_t>(text[i]);
        if ((c < 0x20 && c != '\t' && c != '\n') || c == 0x7F) return true;
        if (c == 0xEF && i + 2 < text.size() && static_cast<uint8_t>(text[i + 1]) == 0xBF &&
            static_cast<uint8_t>(text[i + 2]) >= 0xBE)
            return true;
    }
    return false;
}

std::optional<std::vector<uint8_t>> vcardDecodeBase64(std::string_view text) {
    static constexpr auto table = base64Table();
    std::vector<uint8_t> out;
    out.reserve(text.size() / 4 * 3 + 3);
    uint32_t bits = 0;
    int digits = 0, padding = 0;
    for (char c : text) {
        if (c == ' ' || c == '\t' || c == '\r' || c == '\n') continue;
        if (c == '=') {
            padding++;
            continue;
        }
        int v = table[static_cast<uint8_t>(c)];
        if (v < 0 || padding > 0) return std::nullopt;
        bits = bits << 6 | static_cast<uint32_t>(v);
        if (++digits == 4) {
            out.insert(out.end(),
                       {static_cast<uint8_t>(bits >> 16), static_cast<uint8_t>(bits >> 8), static_cast<uint8_t>(bits)});
            bits = 0, digits = 0;
        }
    }
    if (digits == 1 || padding > 2 || (padding > 0 && digits + padding != 4)) return std::nullopt;
    if (digits == 2) out.push_back(static_cast<uint8_t>(bits >> 4));
    if (digits == 3) {
        out.push_back(static_cast<uint8_t>(bits >> 10));
        out.push_back(static_cast<uint8_t>(bits >> 2));
    }
    return out;
}

std::string vcardEncodeBase64(const std::vector<uint8_t>& bytes) {
    static const char* digits = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    std::string out;
    out.reserve((bytes.size() + 2) / 3 * 4);
    for (size_t i = 0; i < bytes.size(); i += 3) {
        size_t n = std::min<size_t>(3, bytes.size() - i);
        uint32_t bits = static_cast<uint32_t>(bytes[i]) << 16;
        if (n > 1) bits |= static_cast<uint32_t>(bytes[i + 1]) << 8;
        if (n > 2) bits |= bytes[i + 2];
        out += digits[bits >> 18];
        out += digits[bits >> 12 & 63];
        out += n > 1 ? digits[bits >> 6 & 63] : '=';
        out += n > 2 ? digits[bits & 63] : '=';
    }
    return out;
}

std::string vcardDecodeQuotedPrintable(std::string_view text) {
    return decodeHex(text, '=');
}

std::string vcardDecodePercent(std::string_view text) {
    return decodeHex(text, '%');
}

std::optional<std::string> vcardConvertToUTF8(std::string_view text, const std::string& charset) {
    Converter converter(charset.c_str());
    if (!converter.valid()) return std::nullopt;
    std::string out;
    std::array<char, 4096> block;
    char* in = const_cast<char*>(text.data()); // iconv reads through it only
    size_t inLeft = text.size();
    bool flushing = false;
    while (true) {
        char* to = block.data();
        size_t room = block.size();
        size_t r = flushing ? iconv(converter.handle, nullptr, nullptr, &to, &room)
                            : iconv(converter.handle, &in, &inLeft, &to, &room);
        bool full = r == static_cast<size_t>(-1) && errno == E2BIG;
        if (r == static_cast<size_t>(-1) && !full) return std::nullopt;
        out.append(block.data(), static_cast<size_t>(to - block.data()));
        if (full) continue;
        if (flushing) return out;
        flushing = true;
    }
}

bool vcardEqualNoCase(std::string_view a, std::string_view b) {
    if (a.size() != b.size()) return false;
    auto lower = [](char c) { return c >= 'A' && c <= 'Z' ? static_cast<char>(c + 32) : c; };
    for (size_t i = 0; i < a.size(); i++)
        if (lower(a[i]) != lower(b[i])) return false;
    return true;
}

std::string vcardUpper(std::string_view s) {
    std::string out(s);
    for (char& c : out)
        if (c >= 'a' && c <= 'z') c = static_cast<char>(c - 32);
    return out;
}

std::string vcardLower(std::string_view s) {
    std::string out(s);
    for (char& c : out)
        if (c >= 'A' && c <= 'Z') c = static_cast<char>(c + 32);
    return out;
}

std::string_view vcardTrim(std::string_view s) {
    while (!s.empty() && (s.front() == ' ' || s.front() == '\t')) s.remove_prefix(1);
    while (!s.empty() && (s.back() == ' ' || s.back() == '\t')) s.remove_suffix(1);
    return s;
}

} // namespace rolvane
