#include "foundation/Utf8.h"

#include <cstdint>
#include <cstdio>
#include <cstring>

namespace rolvane {

namespace {

bool isXmlCharacter(char32_t c) {
    return c >= 0x20 ? c < 0xfffe || c > 0xffff : c == '\t' || c == '\n' || c == '\r';
}

// The number of leading bytes from 0x20 to 0x7f, eight at a time.
size_t plainPrefix(std::string_view text) {
    size_t i = 0;
    for (; i + 8 <= text.size(); i += 8) {
        uint64_t w;
        std::memcpy(&w, text.data() + i, 8);
        const uint64_t below = (w - 0x2020202020202020u) & ~w; // high bit set in each byte below 0x20 (or after one)
        if ((w | below) & 0x8080808080808080u) break;
    }
    while (i < text.size() && static_cast<unsigned char>(text[i]) >= 0x20 && static_cast<unsigned char>(text[i]) < 0x80)
        ++i;
    return i;
}

} // namespace

std::optional<char32_t> takeCodePoint(std::string_view& rest) {
    if (rest.empty()) return std::nullopt;
    const auto byte = [&](size_t i) { return static_cast<unsigned char>(rest[i]); };
    const unsigned char first = byte(0);
    if (first < 0x80) {
        rest.remove_prefix(1);
        return first;
    }
    const size_t size = first >= 0xf0 ? 4 : first >= 0xe0 ? 3 : 2;
    if (first < 0xc2 || first > 0xf4 || rest.size() < size) return std::nullopt;
    char32_t c = first & (0x7fu >> size);
    for (size_t i = 1; i < size; ++i) {
        if ((byte(i) & 0xc0) != 0x80) return std::nullopt;
        c = c << 6 | (byte(i) & 0x3f);
    }
    const char32_t least = size == 4 ? 0x10000 : size == 3 ? 0x800 : 0x80;
    if (c < least || c > 0x10ffff || (c >= 0xd800 && c <= 0xdfff)) return std::nullopt;
    rest.remove_prefix(size);
    return c;
}

void appendUtf8(char32_t c, std::string& out) {
    const auto tail = [&](int shift) { out += static_cast<char>(0x80 | ((c >> shift) & 0x3f)); };
    if (c < 0x80) {
        out += static_cast<char>(c);
    } else if (c < 0x800) {
        out += static_cast<char>(0xc0 | c >> 6);
        tail(0);
    } else if (c < 0x10000) {
        out += static_cast<char>(0xe0 | c >> 12);
        tail(6);
        tail(0);
    } else {
        out += static_cast<char>(0xf0 | c >> 18);
        tail(12);
        tail(6);
        tail(0);
    }
}

bool isUtf8(std::string_view text) {
    for (;;) {
        text.remove_prefix(plainPrefix(text));
        if (text.empty()) return true;
        if (!takeCodePoint(text)) return false;
    }
}

size_t utf16Length(std::string_view text) {
    size_t units = 0;
    while (!text.empty()) {
        const auto c = takeCodePoint(text);
        if (!c) text.remove_prefix(1);
        units += c && *c > 0xffff ? 2 : 1;
    }
    return units;
}

std::optional<std::string> xmlTextFault(std::string_view text) {
    const char* start = text.data();
    for (;;) {
        text.remove_prefix(plainPrefix(text));
        if (text.empty()) return std::nullopt;
        const auto at = text.data() - start;
        const auto c = takeCodePoint(text);
        if (!c) return "it is not UTF-8 at byte " + std::to_string(at);
        if (isXmlCharacter(*c)) continue;
        char number[16];
        std::snprintf(number, sizeof number, "U+%04X", static_cast<unsigned>(*c));
        return std::string("it has the character ") + number + " at byte " + std::to_string(at) +
               ", which XML cannot carry";
    }
}

} // namespace rolvane
