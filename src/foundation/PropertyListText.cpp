#include "foundation/PropertyListText.h"

#include "foundation/CXException.h"
#include "foundation/Utf8.h"

#include <algorithm>
#include <cctype>
#include <fmt/format.h>

namespace rolvane {

namespace {

constexpr size_t kMaxTag = 512;

[[noreturn]] void refuse(std::string_view before, const std::string& reason) {
    const auto line = 1 + std::count(before.begin(), before.end(), '\n');
    throw CXException(kCXPropertyListException, fmt::format("line {}: {}", line, reason));
}

std::string fromUtf16(std::string_view text, bool bigEndian) {
    std::string out;
    out.reserve(text.size() / 2);
    const auto unit = [&](size_t i) {
        const auto a = static_cast<unsigned char>(text[i]), b = static_cast<unsigned char>(text[i + 1]);
        return static_cast<char32_t>(bigEndian ? a << 8 | b : b << 8 | a);
    };
    if (text.size() % 2 != 0) refuse("", "the text is UTF-16 with an odd number of bytes");
    for (size_t i = 0; i < text.size(); i += 2) {
        char32_t c = unit(i);
        if (c >= 0xd800 && c <= 0xdbff && i + 2 < text.size() && (unit(i + 2) & 0xfc00) == 0xdc00) {
            c = 0x10000 + ((c - 0xd800) << 10) + (unit(i + 2) - 0xdc00);
            i += 2;
        }
        if (c >= 0xd800 && c <= 0xdfff) refuse(out, "the text is UTF-16 with half of a pair");
        appendUtf8(c, out);
    }
    return out;
}

// The encoding that an XML declaration names, or nothing.
std::string_view declaredEncoding(std::string_view text) {
    if (!text.starts_with("<?xml")) return {};
    const std::string_view declaration = text.substr(0, std::min(text.find("?>"), size_t{256}));
    const size_t at = declaration.find("encoding");
    if (at == std::string_view::npos) return {};
    const size_t open = declaration.find_first_of("\"'", at);
    if (open == std::string_view::npos) return {};
    const size_t close = declaration.find(declaration[open], open + 1);
    if (close == std::string_view::npos) return {};
    return declaration.substr(open + 1, close - open - 1);
}

void checkEncoding(std::string_view text, bool wasUtf16) {
    std::string name(declaredEncoding(text));
    std::transform(name.begin(), name.end(), name.begin(), [](unsigned char c) { return std::toupper(c); });
    const bool fits = wasUtf16 ? name.starts_with("UTF-16") : name == "UTF-8" || name == "US-ASCII" || name == "ASCII";
    if (!name.empty() && !fits) refuse("", fmt::format("the text says that it is in \"{}\"", name));
}

// The end of what begins with '<' at `at`, or npos when it does not end.
size_t endOfMarkup(std::string_view text, size_t at) {
    const std::string_view rest = text.substr(at);
    if (rest.starts_with("<!--")) return text.find("-->", at + 4);
    if (rest.starts_with("<![CDATA[")) return text.find("]]>", at + 9);
    if (rest.starts_with("<?")) return text.find("?>", at + 2);
    const std::string_view within = rest.substr(0, kMaxTag);
    char quote = 0;
    for (size_t i = 1; i < within.size(); ++i) {
        const char c = within[i];
        if (quote ? c == quote : c == '"' || c == '\'') quote = quote ? 0 : c;
        if (c == '>' && !quote) return at + i;
    }
    if (rest.size() > kMaxTag) refuse(text.substr(0, at), fmt::format("a tag is longer than {} bytes", kMaxTag));
    return std::string_view::npos;
}

// Ill-formed text is left to the parser, which says what is wrong with it.
void checkTags(std::string_view text) {
    for (size_t at = text.find('<'); at != std::string_view::npos; at = text.find('<', at)) {
        at = endOfMarkup(text, at);
        if (at == std::string_view::npos) return;
    }
}

} // namespace

std::string_view preparePropertyListText(std::string_view text, std::string& converted) {
    const bool little = text.starts_with("\xff\xfe"), big = text.starts_with("\xfe\xff");
    if (little || big) {
        converted = fromUtf16(text.substr(2), big);
        text = converted;
    } else if (text.starts_with("\xef\xbb\xbf")) {
        text.remove_prefix(3);
    }
    if (const size_t zero = text.find('\0'); zero != std::string_view::npos)
        refuse(text.substr(0, zero), "there is a zero byte in the text");
    const size_t first = text.find_first_not_of(" \t\r\n");
    if (first == std::string_view::npos) refuse("", "the text is empty");
    if (text[first] != '<') refuse(text.substr(0, first), "the text is not XML: it does not begin with \"<\"");
    checkEncoding(text, little || big);
    checkTags(text);
    return text;
}

} // namespace rolvane
