#include "contacts/vcard/VCardKept.h"

#include "contacts/vcard/VCardText.h"

#include <algorithm>
#include <array>

namespace rolvane {

namespace {

struct Media {
    std::string_view name, family; // "LOGO", "image"
};
constexpr std::array<Media, 4> kMedia{
    {{"PHOTO", "image"}, {"LOGO", "image"}, {"SOUND", "audio"}, {"KEY", "application"}}};

// Words of TYPE in vCard 3.0 whose media type is called otherwise.
struct Word {
    std::string_view word, mediaType;
};
constexpr std::array<Word, 4> kWords{
    {{"JPG", "image/jpeg"}, {"PGP", "application/pgp-keys"}, {"X509", "application/pkix-cert"}, {"WAVE", "audio/wav"}}};

constexpr std::string_view kUnknownMedia = "application/octet-stream";

const Media* mediaOf(const VCardLine& line) {
    for (const auto& m : kMedia)
        if (line.name == m.name) return &m;
    return nullptr;
}

VCardParameter* parameterOf(VCardLine& line, std::string_view name) {
    for (auto& p : line.parameters)
        if (p.name == name) return &p;
    return nullptr;
}

void remove(VCardLine& line, std::string_view name) {
    std::erase_if(line.parameters, [&](const VCardParameter& p) { return p.name == name; });
}

bool isMediaType(std::string_view text) {
    const size_t slash = text.find('/');
    return slash != std::string_view::npos && slash > 0 && slash + 1 < text.size() &&
           text.find_first_of(" ;,:\"\t\n\\^") == std::string_view::npos && vcardLower(text) == text;
}

std::string mediaTypeOf(const Media& media, const std::string& word) {
    if (word.find('/') != std::string::npos) return vcardLower(word);
    for (const auto& w : kWords)
        if (vcardEqualNoCase(w.word, word)) return std::string(w.mediaType);
    return std::string(media.family) + "/" + vcardLower(word);
}

// The word for a media type, or the type itself where reading the word would give another one.
std::string wordOf(const Media& media, const std::string& mediaType) {
    for (const auto& w : kWords)
        if (w.mediaType == mediaType && mediaTypeOf(media, std::string(w.word)) == mediaType && w.word != "JPG")
            return std::string(w.word);
    const size_t slash = mediaType.find('/');
    std::string word = vcardUpper(mediaType.substr(slash + 1));
    const bool plain = std::all_of(word.begin(), word.end(),
                                   [](char c) { return (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '-'; });
    return plain && mediaTypeOf(media, word) == mediaType ? word : mediaType;
}

bool saysNoMedia(const std::string& type) {
    for (std::string_view t : {"pref", "home", "work"})
        if (vcardEqualNoCase(t, type)) return true;
    return type.empty();
}

// Takes the word of the media type out of TYPE.
std::string takeMediaType(VCardLine& line, const Media& media) {
    std::string found = vcardLower(line.firstValueOf("MEDIATYPE"));
    remove(line, "MEDIATYPE");
    if (VCardParameter* types = parameterOf(line, "TYPE")) {
        const auto word = std::find_if_not(types->values.begin(), types->values.end(), saysNoMedia);
        if (word != types->values.end()) {
            if (found.empty()) found = mediaTypeOf(media, *word);
            types->values.erase(word);
        }
        if (types->values.empty()) remove(line, "TYPE");
    }
    return isMediaType(found) ? found : std::string(kUnknownMedia);
}

bool isURI(std::string_view text) {
    const size_t colon = text.find(':');
    if (colon == std::string_view::npos || colon < 2) return false;
    return std::all_of(text.begin(), text.begin() + static_cast<long>(colon), [](char c) {
        return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '+' || c == '-' ||
               c == '.';
    });
}

bool isInline(const VCardLine& line) {
    const std::string encoding = line.firstValueOf("ENCODING");
    return vcardEqualNoCase(encoding, "b") || vcardEqualNoCase(encoding, "base64");
}

// "data:image/png;base64,…": where its media type ends and where its data begin.
struct DataURI {
    std::string mediaType;
    std::string_view data;
};
std::optional<DataURI> dataURIOf(const std::string& value) {
    if (vcardLower(value.substr(0, 5)) != "data:") return std::nullopt;
    const size_t comma = value.find(',');
    if (comma == std::string::npos || comma > 200) return std::nullopt;
    // In a text an escape may stand before the comma and the semicolon.
    const std::string head = vcardUnescape(value.substr(5, comma - 5 - (value[comma - 1] == '\\' ? 1 : 0)));
    if (!vcardLower(head).ends_with(";base64")) return std::nullopt;
    const std::string mediaType = vcardLower(head.substr(0, head.size() - 7));
    if (!isMediaType(mediaType)) return std::nullopt;
    return DataURI{mediaType, std::string_view(value).substr(comma + 1)};
}

// False when the binary value is damaged.
bool makeMediaUniform(VCardLine& line, const Media& media) {
    const auto uri = dataURIOf(line.value);
    if (uri || isInline(line)) {
        const auto bytes = vcardDecodeBase64(uri ? uri->data : std::string_view(line.value));
        if (!bytes) return false;
        std::string mediaType = uri ? uri->mediaType : takeMediaType(line, media);
        line.value = "data:" + mediaType + ";base64," + vcardEncodeBase64(*bytes);
        for (const char* spent : {"ENCODING", "VALUE", "MEDIATYPE"}) remove(line, spent);
        return true;
    }
    const std::string value = vcardLower(line.firstValueOf("VALUE"));
    if (value == "inline" || value == "binary" || value == "url" || value == "uri") remove(line, "VALUE");
    if (value == "text" || line.value.empty()) return true;
    if (line.parameter("VALUE")) return true; // of a type of its own
    if (isURI(line.value))
        line.parameters.insert(line.parameters.begin(), {"VALUE", {"uri"}});
    else if (line.name == "KEY")
        line.parameters.insert(line.parameters.begin(), {"VALUE", {"text"}});
    return true;
}

// Two numbers with a separator between them, joined by another one: "12.5;42.25" -> "12.5,42.25". Nothing when the text
// is anything else.
std::optional<std::string> rejoinedNumbers(std::string_view text, char separator, char other) {
    const size_t at = text.find(separator);
    const auto isNumber = [](std::string_view number) {
        return number.find_first_of("0123456789") != std::string_view::npos &&
               number.find_first_not_of("-.0123456789") == std::string_view::npos;
    };
    if (at == std::string_view::npos || !isNumber(text.substr(0, at)) || !isNumber(text.substr(at + 1)))
        return std::nullopt;
    return std::string(text.substr(0, at)) + other + std::string(text.substr(at + 1));
}

// A place is a pair of numbers in 3.0 (RFC 2426 section 3.4.2), and a URI in 4.0 (RFC 6350 section 6.5.2).
constexpr std::string_view kGeoScheme = "geo:";

// Properties that vCard 4.0 has given up, and those of which a card has one, which is written elsewhere.
bool isForeignTo(std::string_view name, bool version4) {
    for (std::string_view once : {"FN", "N", "BDAY", "KIND"})
        if (name == once) return true;
    if (!version4) return false;
    for (std::string_view old : {"AGENT", "LABEL", "MAILER", "CLASS", "NAME", "PROFILE", "SORT-STRING"})
        if (name == old) return true;
    return false;
}

} // namespace

std::optional<VCardLine> vcardKeptForm(VCardLine line) {
    if (VCardParameter* types = parameterOf(line, "TYPE")) {
        const size_t before = types->values.size();
        std::erase_if(types->values, [](const std::string& t) { return vcardEqualNoCase(t, "pref"); });
        const bool preferred = types->values.size() < before;
        if (types->values.empty()) remove(line, "TYPE");
        if (preferred && !line.parameter("PREF")) line.add("PREF", "1");
    }
    if (const Media* media = mediaOf(line))
        if (!makeMediaUniform(line, *media)) return std::nullopt;
    if (line.name == "GEO" && !line.parameter("VALUE"))
        if (const auto place = rejoinedNumbers(line.value, ';', ',')) line.value = std::string(kGeoScheme) + *place;
    return line;
}

std::optional<VCardLine> vcardKeptLineFor(const VCardLine& kept, bool version4) {
    if (isForeignTo(kept.name, version4)) return std::nullopt;
    VCardLine line = kept;
    const Media* media = mediaOf(line);
    const auto uri = media ? dataURIOf(line.value) : std::nullopt;
    const bool isText = media && !uri && !line.value.empty() && !isURI(line.value);
    if (isText && line.name != "KEY") return std::nullopt;
    if (version4) return line.parameter("ENCODING") ? std::nullopt : std::optional(line);
    if (uri) {
        const std::string data(uri->data);
        const std::string word = wordOf(*media, uri->mediaType);
        line.value = data;
        std::vector<std::string> types{word};
        if (const VCardParameter* own = line.parameter("TYPE"))
            types.insert(types.end(), own->values.begin(), own->values.end());
        remove(line, "TYPE");
        line.parameters.insert(line.parameters.begin(), {{"ENCODING", {"b"}}, {"TYPE", types}});
    } else if (media && line.value.starts_with("data:")) {
        return std::nullopt; // of a kind that has no other spelling
    }
    if (line.name == "GEO" && line.value.starts_with(kGeoScheme)) {
        const auto place = rejoinedNumbers(std::string_view(line.value).substr(kGeoScheme.size()), ',', ';');
        if (!place) return std::nullopt; // with an altitude, or an uncertainty
        line.value = *place;
    }
    if (line.firstValueOf("PREF") == "1") {
        remove(line, "PREF");
        line.add("TYPE", "pref");
    }
    const auto again = vcardKeptForm(line);
    return again && *again == kept ? std::optional(line) : std::nullopt;
}

} // namespace rolvane
