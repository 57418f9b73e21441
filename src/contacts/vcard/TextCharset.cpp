#include "contacts/vcard/TextCharset.h"

#include "contacts/vcard/VCardText.h"

#include <algorithm>
#include <array>
#include <memory>
#include <uchardet/uchardet.h>

namespace rolvane {

namespace {

constexpr size_t kSampleBytes = 256 << 10;

// Of one byte a letter, for languages of Western Europe. They agree on nearly all letters, and the statistics of a few
// names do not tell them apart.
constexpr std::array<std::string_view, 11> kWestern{"ISO-8859-1",   "ISO-8859-3",   "ISO-8859-4",  "ISO-8859-9",
                                                    "ISO-8859-10",  "ISO-8859-13",  "ISO-8859-15", "ISO-8859-16",
                                                    "WINDOWS-1252", "WINDOWS-1257", "WINDOWS-1258"};

bool isHigh(char c) {
    return static_cast<unsigned char>(c) >= 0x80;
}

// How many letters of the text are written in more than ASCII, of a hundred.
size_t highShare(std::string_view text) {
    size_t high = 0, letters = 0;
    for (const char c : text) {
        if (isHigh(c)) high++;
        if (isHigh(c) || (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z')) letters++;
    }
    return letters == 0 ? 0 : high * 100 / letters;
}

bool hasForeignBytes(std::string_view text) {
    return vcardFirstInvalidUTF8(text).has_value();
}

} // namespace

std::string detectedCharset(std::string_view sample) {
    const std::unique_ptr<uchardet, decltype(&uchardet_delete)> detector(uchardet_new(), uchardet_delete);
    std::string found;
    if (uchardet_handle_data(detector.get(), sample.data(), sample.size()) == 0) {
        uchardet_data_end(detector.get());
        found = vcardUpper(uchardet_get_charset(detector.get()));
    }
    const bool western = std::find(kWestern.begin(), kWestern.end(), found) != kWestern.end();
    const bool sayingNothing = found.empty() || found == "ASCII" || found == "UTF-8" || found.starts_with("UTF-16");
    // Where few letters are foreign, the language has Latin letters: scripts of their own and Macintosh sets that the
    // statistics of short names bring forth are mistaken.
    const bool latin2 = found == "ISO-8859-2" || found == "WINDOWS-1250";
    const bool unlikely = highShare(sample) < 30 && !latin2;
    if (western || sayingNothing || unlikely || !isKnownCharset(found)) return "WINDOWS-1252";
    if (found == "ISO-8859-2") return "WINDOWS-1250"; // as Windows writes it; printable letters are alike but for a few
    if (!vcardConvertToUTF8(sample, found)) return "WINDOWS-1252";
    return found;
}

bool isKnownCharset(const std::string& charset) {
    return !charset.empty() && vcardConvertToUTF8("", charset).has_value();
}

std::string foreignTextOfCards(std::istream& in) {
    std::string sample, line;
    while (sample.size() < kSampleBytes && std::getline(in, line)) {
        const std::string head = vcardUpper(line.substr(0, std::min<size_t>(line.find(':'), 512)));
        if (head.find("CHARSET") != std::string::npos) continue;
        if (head.find("QUOTED-PRINTABLE") != std::string::npos) line = vcardDecodeQuotedPrintable(line);
        if (hasForeignBytes(line)) (sample += line.substr(0, 4096)) += '\n';
    }
    in.clear();
    in.seekg(0);
    return sample;
}

bool beginsAsUTF16(std::string_view start) {
    if (start.starts_with("\xFF\xFE") || start.starts_with("\xFE\xFF")) return true;
    return start.size() >= 4 && ((start[0] == 0 && start[1] != 0) || (start[0] != 0 && start[1] == 0)) &&
           (start[2] == 0) != (start[3] == 0);
}

std::optional<std::string> textFromUTF16(std::string_view text) {
    if (!beginsAsUTF16(text)) return std::nullopt;
    const bool mark = text.starts_with("\xFF\xFE") || text.starts_with("\xFE\xFF");
    const bool little = mark ? text[0] == '\xFF' : text[0] != 0;
    if (mark) text.remove_prefix(2);
    if (text.size() % 2 == 1) text.remove_suffix(1);
    return vcardConvertToUTF8(text, little ? "UTF-16LE" : "UTF-16BE");
}

} // namespace rolvane
