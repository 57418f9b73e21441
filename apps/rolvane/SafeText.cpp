#include "SafeText.h"

#include "contacts/vcard/VCardText.h"

#include <algorithm>
#include <cstdint>
#include <fmt/format.h>

namespace rolvane::cli {

namespace {

// The scalar value at `i` and how many bytes it takes; 0 bytes for no UTF-8.
struct Scalar {
    uint32_t value;
    size_t bytes;
};

Scalar scalarAt(std::string_view text, size_t i) {
    const auto first = static_cast<uint8_t>(text[i]);
    const size_t bytes = first < 0x80 ? 1 : first < 0xC0 ? 0 : first < 0xE0 ? 2 : first < 0xF0 ? 3 : 4;
    if (bytes == 0 || vcardFirstInvalidUTF8(text.substr(i, bytes))) return {0xFFFD, 0};
    if (bytes == 1) return {first, 1};
    uint32_t value = first & (0xFFU >> (bytes + 1));
    for (size_t k = 1; k < bytes; k++) value = value << 6 | (static_cast<uint8_t>(text[i + k]) & 0x3F);
    return {value, bytes};
}

bool steers(uint32_t c) {
    return c < 0x20 || (c >= 0x7F && c < 0xA0);
}

// Marks, embeddings, overrides and isolates of direction (Unicode Bidirectional Algorithm), and separators of lines.
bool turns(uint32_t c) {
    return c == 0x061C || c == 0x200E || c == 0x200F || (c >= 0x2028 && c <= 0x202E) || (c >= 0x2066 && c <= 0x2069);
}

template <class Keeps>
std::string escaped(std::string_view text, const Keeps& keeps) {
    std::string out;
    out.reserve(text.size());
    for (size_t i = 0; i < text.size();) {
        size_t plain = i; // nearly everything
        while (plain < text.size() && text[plain] >= ' ' && text[plain] < '\x7F') plain++;
        out.append(text, i, plain - i);
        i = plain;
        if (i == text.size()) break;
        const auto [value, bytes] = scalarAt(text, i);
        if (bytes == 0)
            out += "\uFFFD";
        else if (keeps(value))
            out += text.substr(i, bytes);
        else
            out += fmt::format("\\u{:04x}", value);
        i += std::max<size_t>(bytes, 1);
    }
    return out;
}

// East Asian wide characters and emoji take two columns, combining marks none.
size_t widthOf(uint32_t c) {
    if ((c >= 0x300 && c <= 0x36F) || (c >= 0x200B && c <= 0x200D) || (c >= 0xFE00 && c <= 0xFE0F)) return 0;
    const bool wide = (c >= 0x1100 && c <= 0x115F) || (c >= 0x2E80 && c <= 0xA4CF) || (c >= 0xAC00 && c <= 0xD7A3) ||
                      (c >= 0xF900 && c <= 0xFAFF) || (c >= 0xFE30 && c <= 0xFE6F) || (c >= 0xFF00 && c <= 0xFF60) ||
                      (c >= 0x1F300 && c <= 0x1FAFF) || (c >= 0x20000 && c <= 0x3FFFD);
    return wide ? 2 : 1;
}

} // namespace

std::string shownText(std::string_view text) {
    return escaped(text, [](uint32_t c) { return c == '\n' || c == '\t' || (!steers(c) && !turns(c)); });
}

std::string shownLine(std::string_view text) {
    return escaped(text, [](uint32_t c) { return !steers(c) && !turns(c); });
}

std::string shownJson(std::string_view json) {
    return shownText(json); // all of these stand within strings, where the escape means the character
}

size_t columnsOf(std::string_view text) {
    size_t columns = 0;
    for (size_t i = 0; i < text.size();) {
        const auto [value, bytes] = scalarAt(text, i);
        columns += widthOf(value);
        i += std::max<size_t>(bytes, 1);
    }
    return columns;
}

std::string cutTo(std::string_view text, size_t columns) {
    if (columnsOf(text) <= columns) return std::string(text);
    size_t used = 1, i = 0; // the dots take one
    while (i < text.size()) {
        const auto [value, bytes] = scalarAt(text, i);
        if (used + widthOf(value) > columns) break;
        used += widthOf(value);
        i += std::max<size_t>(bytes, 1);
    }
    return std::string(text.substr(0, i)) += columns == 0 ? "" : "…";
}

} // namespace rolvane::cli
