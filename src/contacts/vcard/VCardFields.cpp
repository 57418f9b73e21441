#include "contacts/vcard/VCardFields.h"

#include "contacts/records/CXMultiValue.h"
#include "contacts/records/Constants.h"
#include "contacts/vcard/VCardText.h"

#include <array>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <openssl/evp.h>

namespace rolvane {

namespace {

constexpr std::array<VCardMultiField, 7> kMultiFields{{
    {"TEL", kCXPhoneProperty, true, true, ""},
    {"EMAIL", kCXEmailProperty, true, true, ""},
    {"ADR", kCXAddressProperty, true, true, ""},
    {"URL", kCXURLsProperty, true, true, ""},
    {"IMPP", kCXInstantMessageProperty, true, true, ""},
    {"RELATED", kCXRelatedNamesProperty, false, true, "RELATEDNAMES"},
    {"DATE", kCXOtherDatesProperty, false, false, "DATE"},
}};

// The first name of a property is the one that is written.
constexpr std::pair<const char*, const char*> kTextLines[] = {
    {"NOTE", kCXNoteProperty},
    {"TITLE", kCXJobTitleProperty},
    {"X-ROLVANE-MAIDEN-NAME", kCXMaidenNameProperty},
    {"X-MAIDENNAME", kCXMaidenNameProperty},
    {"X-ROLVANE-PHONETIC-FIRST", kCXFirstNamePhoneticProperty},
    {"X-PHONETIC-FIRST-NAME", kCXFirstNamePhoneticProperty},
    {"X-ROLVANE-PHONETIC-MIDDLE", kCXMiddleNamePhoneticProperty},
    {"X-PHONETIC-MIDDLE-NAME", kCXMiddleNamePhoneticProperty},
    {"X-ROLVANE-PHONETIC-LAST", kCXLastNamePhoneticProperty},
    {"X-PHONETIC-LAST-NAME", kCXLastNamePhoneticProperty},
};

constexpr std::string_view kOwnPrefix = "X-ROLVANE-";

constexpr std::array<const char*, 7> kAddressKeys{kCXAddressPOBoxKey,  kCXAddressExtendedKey, kCXAddressStreetKey,
                                                  kCXAddressCityKey,   kCXAddressStateKey,    kCXAddressZIPKey,
                                                  kCXAddressCountryKey};

constexpr std::array<const char*, 5> kNameKeys{kCXLastNameProperty, kCXFirstNameProperty, kCXMiddleNameProperty,
                                               kCXTitleProperty, kCXSuffixProperty};

bool isURIField(std::string_view property) {
    return property == kCXURLsProperty || property == kCXInstantMessageProperty;
}

Value decodeAddress(const VCardLine& line) {
    Dictionary address;
    auto parts = vcardSplit(line.value, ';');
    for (size_t i = 0; i < parts.size() && i < kAddressKeys.size(); i++) {
        std::string text = vcardUnescape(parts[i]);
        if (!vcardTrim(text).empty()) address.set(kAddressKeys[i], text);
    }
    std::string code = line.firstValueOf("CC"); // RFC 8605
    if (!code.empty() && !address.empty()) address.set(kCXAddressCountryCodeKey, code);
    return address.empty() ? Value() : Value(address);
}

std::optional<std::string> encodeAddress(const Value& value) {
    const Dictionary* address = value.dictionaryIf();
    if (!address || address->empty()) return std::nullopt;
    std::string raw;
    size_t used = 0;
    for (size_t i = 0; i < kAddressKeys.size(); i++) {
        if (i > 0) raw += ';';
        const Value& part = (*address)[kAddressKeys[i]];
        if (!part) continue;
        if (!part.isString() || vcardTrim(part.string()).empty() || !vcardIsPlainText(part.string()))
            return std::nullopt;
        raw += vcardEscape(part.string());
        used++;
    }
    const Value& code = (*address)[kCXAddressCountryCodeKey];
    if (code && (!code.isString() || code.string().empty() || !vcardIsPlainText(code.string()) || used == 0))
        return std::nullopt;
    if (used + (code ? 1 : 0) != address->count()) return std::nullopt; // keys that an ADR has no place for
    return raw;
}

std::string joinList(std::string_view part, std::string_view separator) {
    std::string out;
    for (auto item : vcardSplit(part, ',')) {
        std::string text = vcardUnescape(item);
        std::string_view trimmed = vcardTrim(text);
        if (trimmed.empty()) continue;
        if (!out.empty()) out += separator;
        out += trimmed;
    }
    return out;
}

std::string textOf(const Dictionary& d, std::string_view key) {
    const Value& v = d[key];
    return v.isString() && vcardIsPlainText(v.string()) ? v.string() : std::string();
}

bool digits(std::string_view s) {
    for (char c : s)
        if (c < '0' || c > '9') return false;
    return !s.empty();
}

int number(std::string_view s) {
    int n = 0;
    for (char c : s) n = n * 10 + (c - '0');
    return n;
}

// "1985-04-12" or "19850412"; nothing for anything else and for days that no month has.
std::optional<std::chrono::sys_days> decodeDay(std::string_view t) {
    std::string plain;
    if (t.size() == 10 && t[4] == '-' && t[7] == '-')
        plain = std::string(t.substr(0, 4)) += std::string(t.substr(5, 2)) += t.substr(8);
    else
        plain = std::string(t);
    if (plain.size() != 8 || !digits(plain)) return std::nullopt;
    std::string_view p = plain;
    std::chrono::year_month_day day{std::chrono::year(number(p.substr(0, 4))),
                                    std::chrono::month(static_cast<unsigned>(number(p.substr(4, 2)))),
                                    std::chrono::day(static_cast<unsigned>(number(p.substr(6, 2))))};
    if (!day.ok() || day.year() < std::chrono::year(1)) return std::nullopt; // what could not be written again
    return std::chrono::sys_days(day);
}

// "23:10:00Z" or "231000Z"; seconds since midnight.
std::optional<int> decodeTime(std::string_view t) {
    if (!t.ends_with('Z')) return std::nullopt;
    t.remove_suffix(1);
    std::string plain;
    if (t.size() == 8 && t[2] == ':' && t[5] == ':')
        plain = std::string(t.substr(0, 2)) += std::string(t.substr(3, 2)) += t.substr(6);
    else
        plain = std::string(t);
    if (plain.size() != 6 || !digits(plain)) return std::nullopt;
    std::string_view p = plain;
    int h = number(p.substr(0, 2)), m = number(p.substr(2, 2)), s = number(p.substr(4, 2));
    if (h > 23 || m > 59 || s > 59) return std::nullopt;
    return h * 3600 + m * 60 + s;
}

std::string mediaTypeOfWord(const std::string& word) {
    std::string lower = vcardLower(word);
    if (lower.find('/') != std::string::npos) return lower;
    if (lower == "jpg") lower = "jpeg";
    return "image/" + lower;
}

std::optional<VCardPhoto> decodeDataURI(const std::string& uri, std::string& reason) {
    size_t comma = uri.find(',');
    if (comma == std::string::npos) {
        reason = "the photo's data: URI has no comma";
        return std::nullopt;
    }
    std::string head = uri.substr(5, comma - 5);
    std::string_view data = std::string_view(uri).substr(comma + 1);
    VCardPhoto photo;
    photo.mediaType = vcardLower(head.substr(0, head.find(';')));
    if (vcardLower(head).ends_with(";base64")) {
        auto bytes =
            vcardDecodeBase64(data.find('%') == std::string_view::npos ? std::string(data) : vcardDecodePercent(data));
        if (!bytes) {
            reason = "the photo's base64 is damaged";
            return std::nullopt;
        }
        photo.bytes = std::move(*bytes);
    } else {
        std::string plain = vcardDecodePercent(data);
        photo.bytes.assign(plain.begin(), plain.end());
    }
    return photo;
}

bool startsWith(const Bytes& bytes, std::string_view magic, size_t at = 0) {
    return bytes.size() >= at + magic.size() &&
           std::equal(magic.begin(), magic.end(), bytes.begin() + static_cast<long>(at),
                      [](char a, uint8_t b) { return static_cast<uint8_t>(a) == b; });
}

std::string digestOf(const Bytes& bytes) {
    if (bytes.empty()) return "";
    Bytes digest(EVP_MAX_MD_SIZE);
    unsigned length = 0;
    EVP_Digest(bytes.data(), bytes.size(), digest.data(), &length, EVP_sha256(), nullptr);
    digest.resize(length);
    return vcardEncodeBase64(digest);
}

std::string firstValueOf(const Dictionary& person, std::string_view property) {
    const Array* values =
        person[property].dictionaryIf() ? (*person[property].dictionaryIf())["values"].arrayIf() : nullptr;
    return values && !values->empty() && vcardIsPlainText((*values)[0].string()) ? (*values)[0].string()
                                                                                 : std::string();
}

} // namespace

const VCardMultiField* vcardMultiFieldForLine(std::string_view lineName, bool labelled) {
    std::string_view own = lineName.starts_with(kOwnPrefix) ? lineName.substr(kOwnPrefix.size()) : std::string_view();
    for (const auto& f : kMultiFields) {
        if (lineName == f.lineName && (f.inVersion3 || f.inVersion4)) return &f;
        if (own == f.lineName) return &f;
        if (lineName == "X-ABDATE" && f.property == std::string_view(kCXOtherDatesProperty)) return &f;
        bool suffixed = *f.xSuffix && lineName.starts_with("X-") && lineName.ends_with(f.xSuffix);
        if (labelled && suffixed) return &f;
    }
    if (lineName == "ANNIVERSARY" || lineName == "X-ANNIVERSARY")
        return vcardMultiFieldForProperty(kCXOtherDatesProperty);
    return nullptr;
}

const VCardMultiField* vcardMultiFieldForProperty(std::string_view property) {
    for (const auto& f : kMultiFields)
        if (property == f.property) return &f;
    return nullptr;
}

bool vcardIsLabelLine(const VCardLine& line) {
    return !line.group.empty() && line.name.starts_with("X-") && line.name.ends_with("LABEL");
}

bool vcardIsPlainText(std::string_view text) {
    return !vcardFirstInvalidUTF8(text) && !vcardHasControlCharacter(text);
}

Value vcardDecodeMultiValue(std::string_view property, const VCardLine& line) {
    if (property == kCXAddressProperty) return decodeAddress(line);
    if (property == kCXOtherDatesProperty) {
        auto date = vcardDecodeDate(line.value);
        return date ? Value(*date) : Value();
    }
    bool uri = vcardEqualNoCase(line.firstValueOf("VALUE"), "uri");
    std::string text = vcardUnescape(line.value);
    // A relation to another card is not a name; the line is kept as it is.
    if (property == kCXRelatedNamesProperty && (uri || text.starts_with("urn:"))) return {};
    if (property == kCXPhoneProperty && uri && vcardLower(text.substr(0, 4)) == "tel:") text.erase(0, 4);
    if (vcardTrim(text).empty()) return {};
    return text;
}

std::optional<std::string> vcardEncodeMultiValue(std::string_view property, const Value& value) {
    if (property == kCXAddressProperty) return encodeAddress(value);
    if (property == kCXOtherDatesProperty) {
        auto date = value.date();
        if (!date) return std::nullopt;
        std::string text = vcardEncodeDate(*date, true);
        return vcardDecodeDate(text) == date ? std::optional(text) : std::nullopt;
    }
    const std::string* text = value.stringIf();
    if (!text || vcardTrim(*text).empty() || !vcardIsPlainText(*text)) return std::nullopt;
    if (property == kCXRelatedNamesProperty && text->starts_with("urn:")) return std::nullopt;
    return isURIField(property) ? vcardEncodeURI(*text) : vcardEscape(*text);
}

std::string vcardEncodeURI(std::string_view text) {
    std::string out;
    for (char c : text) {
        if (c == '\\')
            out += "\\\\";
        else if (c == '\n')
            out += "\\n";
        else
            out += c;
    }
    return out;
}

void vcardDecodeName(const VCardLine& line, Dictionary& person) {
    auto parts = vcardSplit(line.value, ';');
    for (size_t i = 0; i < parts.size() && i < kNameKeys.size(); i++) {
        std::string text = joinList(parts[i], kNameKeys[i] == std::string_view(kCXSuffixProperty) ? ", " : " ");
        if (!text.empty()) person.set(kNameKeys[i], text);
    }
}

std::string vcardEncodeName(const Dictionary& person) {
    std::string raw;
    for (size_t i = 0; i < kNameKeys.size(); i++) {
        if (i > 0) raw += ';';
        raw += vcardEscape(textOf(person, kNameKeys[i]));
    }
    return raw;
}

std::string vcardListedName(const VCardLine& line) {
    if (line.name != "N") return "";
    for (auto part : vcardSplit(line.value, ';'))
        if (vcardSplit(part, ',').size() > 1) return line.value;
    return "";
}

std::string vcardSurplusParts(const VCardLine& line) {
    if (line.name != "ADR" && line.name != "N") return "";
    size_t known = line.name == "ADR" ? kAddressKeys.size() : kNameKeys.size();
    auto parts = vcardSplit(line.value, ';');
    if (parts.size() <= known) return "";
    std::string surplus;
    bool blank = true;
    for (size_t i = known; i < parts.size(); i++) {
        (surplus += i > known ? ";" : "") += parts[i];
        blank = blank && vcardTrim(parts[i]).empty();
    }
    return blank ? "" : surplus;
}

void vcardDecodeOrganization(const VCardLine& line, Dictionary& person) {
    auto parts = vcardSplit(line.value, ';');
    while (parts.size() > 1 && vcardTrim(parts.back()).empty()) parts.pop_back();
    std::string department;
    for (size_t i = 1; i < parts.size(); i++) (department += i > 1 ? "; " : "") += vcardUnescape(parts[i]);
    std::string name = vcardUnescape(parts[0]);
    if (!vcardTrim(name).empty()) person.set(kCXOrganizationProperty, name);
    if (!department.empty()) person.set(kCXDepartmentProperty, department);
}

std::string vcardEncodeOrganization(const Dictionary& person) {
    std::string raw = vcardEscape(textOf(person, kCXOrganizationProperty));
    std::string department = textOf(person, kCXDepartmentProperty);
    if (department.empty()) return raw;
    std::string units = raw;
    for (size_t start = 0; start != std::string::npos;) {
        size_t end = department.find("; ", start);
        (units += ';') += vcardEscape(department.substr(start, end == std::string::npos ? end : end - start));
        start = end == std::string::npos ? end : end + 2;
    }
    Dictionary check;
    VCardLine line;
    line.value = units;
    vcardDecodeOrganization(line, check);
    return check[kCXDepartmentProperty] == Value(department) ? units : raw + ';' + vcardEscape(department);
}

std::vector<std::string> vcardDecodeList(const VCardLine& line) {
    std::vector<std::string> items;
    for (auto part : vcardSplit(line.value, ',')) {
        std::string text = vcardUnescape(part);
        if (!vcardTrim(text).empty()) items.push_back(std::move(text));
    }
    return items;
}

std::string vcardEncodeList(const std::vector<std::string>& items) {
    std::string raw;
    for (const auto& item : items) (raw += raw.empty() ? "" : ",") += vcardEscape(item);
    return raw;
}

void vcardDecodeNickname(const VCardLine& line, Dictionary& person) {
    std::string all;
    for (const auto& n : vcardDecodeList(line)) (all += all.empty() ? "" : ", ") += n;
    if (!all.empty()) person.set(kCXNicknameProperty, all);
}

std::string vcardEncodeNickname(const Dictionary& person) {
    std::string nickname = textOf(person, kCXNicknameProperty);
    std::vector<std::string> items;
    for (size_t start = 0; start != std::string::npos;) {
        size_t end = nickname.find(", ", start);
        items.push_back(nickname.substr(start, end == std::string::npos ? end : end - start));
        start = end == std::string::npos ? end : end + 2;
    }
    Dictionary check;
    VCardLine line;
    line.value = vcardEncodeList(items);
    vcardDecodeNickname(line, check);
    return check[kCXNicknameProperty] == Value(nickname) ? line.value : vcardEscape(nickname);
}

const char* vcardTextPropertyForLine(std::string_view lineName) {
    for (const auto& [line, property] : kTextLines)
        if (lineName == line) return property;
    return nullptr;
}

const char* vcardLineForTextProperty(std::string_view property) {
    for (const auto& [line, p] : kTextLines)
        if (property == p) return line;
    return nullptr;
}

std::string vcardEncodeSingle(std::string_view lineName, const Dictionary& properties, bool isGroup) {
    if (lineName == "KIND")
        return isGroup ? "group" : properties[kCXIsCompanyProperty].boolean() ? "org" : "individual";
    if (lineName == "FN" && isGroup) return vcardEscape(textOf(properties, kCXGroupNameProperty));
    if (lineName == "FN") {
        std::string formatted = textOf(properties, kCXFormattedNameProperty);
        return vcardEscape(formatted.empty() ? vcardDerivedFormattedName(properties) : formatted);
    }
    if (lineName == "N") {
        std::string name = vcardEncodeName(properties);
        return name == ";;;;" ? "" : name;
    }
    if (lineName == "NICKNAME") return vcardEncodeNickname(properties);
    if (lineName == "ORG") return vcardEncodeOrganization(properties);
    if (lineName == "BDAY") {
        if (auto date = properties[kCXBirthdayProperty].date()) return vcardEncodeDate(*date, true);
        return vcardEscape(textOf(properties, kCXBirthdayTextProperty));
    }
    if (lineName == "PHOTO") return digestOf(properties[kCXPhotoProperty].data());
    const char* property = vcardTextPropertyForLine(lineName);
    return property ? vcardEscape(textOf(properties, property)) : std::string();
}

bool vcardIsNeverExact(std::string_view property) {
    for (auto p :
         {kCXVCardExtraProperty, kCXCategoriesProperty, kCXRemoteLocationProperty, kCXReadSharingACLProperty,
          kCXReadWriteSharingACLProperty, kCXUIDProperty, kCXCreationDateProperty, kCXModificationDateProperty})
        if (property == p) return true;
    return false;
}

std::optional<Date> vcardDecodeDate(std::string_view text) {
    text = vcardTrim(text);
    size_t t = text.find('T');
    auto day = decodeDay(text.substr(0, t));
    if (!day) return std::nullopt;
    double seconds = 86400.0 * static_cast<double>(day->time_since_epoch().count());
    if (t == std::string_view::npos) return Date(seconds);
    auto time = decodeTime(text.substr(t + 1));
    if (!time) return std::nullopt;
    return Date(seconds + *time);
}

std::string vcardEncodeDate(Date date, bool version4) {
    double whole = std::floor(date.secondsSince1970());
    if (!(whole > -62135596800.0 - 86400.0 && whole < 253402300800.0)) return ""; // years 1 to 9999
    auto seconds = static_cast<int64_t>(whole);
    int64_t days = seconds / 86400, rest = seconds % 86400;
    if (rest < 0) days--, rest += 86400;
    std::chrono::year_month_day day{std::chrono::sys_days(std::chrono::days(days))};
    char text[64];
    int n = std::snprintf(text, sizeof text, version4 ? "%04d%02u%02u" : "%04d-%02u-%02u", static_cast<int>(day.year()),
                          static_cast<unsigned>(day.month()), static_cast<unsigned>(day.day()));
    if (rest)
        std::snprintf(text + n, sizeof text - static_cast<size_t>(n), version4 ? "T%02d%02d%02dZ" : "T%02d:%02d:%02dZ",
                      static_cast<int>(rest / 3600), static_cast<int>(rest / 60 % 60), static_cast<int>(rest % 60));
    return text;
}

bool vcardIsTruncatedDate(std::string_view t) {
    if (t.size() == 4) return digits(t);                                                    // 1985
    if (t.size() == 7) return digits(t.substr(0, 4)) && t[4] == '-' && digits(t.substr(5)); // 1985-04
    if (t.size() == 6) return t.starts_with("--") && digits(t.substr(2));                   // --0412
    return t.size() == 5 && t.starts_with("---") && digits(t.substr(3));                    // ---12
}

std::string vcardDayOfYear(std::string_view t) {
    std::string plain(t);
    if (plain.size() == 7 && plain[4] == '-') plain.erase(4, 1);
    if (plain.size() != 6 || !plain.starts_with("--") || !digits(std::string_view(plain).substr(2))) return "";
    // 1604 was a leap year.
    return decodeDay("1604" + plain.substr(2)) ? plain : std::string();
}

int vcardOmittedYear(const VCardLine& line) {
    for (const auto& p : line.parameters) {
        const bool named = p.name.starts_with("X-") && p.name.ends_with("OMIT-YEAR") && p.values.size() == 1;
        if (named && p.values[0].size() == 4 && digits(p.values[0])) return number(p.values[0]);
    }
    return 0;
}

std::optional<VCardPhoto> vcardDecodePhoto(const VCardLine& line, std::string& reason) {
    std::optional<VCardPhoto> photo;
    std::string encoding = line.firstValueOf("ENCODING");
    bool inlined = vcardEqualNoCase(encoding, "b") || vcardEqualNoCase(encoding, "base64");
    if (vcardLower(line.value.substr(0, 5)) == "data:") {
        photo = decodeDataURI(vcardUnescape(line.value), reason);
    } else if (inlined) {
        auto bytes = vcardDecodeBase64(line.value);
        if (!bytes)
            reason = "the photo's base64 is damaged";
        else
            photo = VCardPhoto{std::move(*bytes), {}};
        for (const auto& type : line.types())
            if (photo && photo->mediaType.empty() && !type.empty() && type != "pref")
                photo->mediaType = mediaTypeOfWord(type);
    }
    if (photo && photo->mediaType.empty()) photo->mediaType = vcardSniffMediaType(photo->bytes);
    return photo;
}

VCardLine vcardEncodePhoto(const VCardPhoto& photo, bool version4) {
    VCardLine line;
    line.name = "PHOTO";
    std::string type = photo.mediaType.empty() ? vcardSniffMediaType(photo.bytes) : photo.mediaType;
    std::string data = vcardEncodeBase64(photo.bytes);
    if (version4) {
        line.value = "data:" + type + ";base64," + data;
        return line;
    }
    line.add("ENCODING", "b");
    if (!type.empty()) line.add("TYPE", type.starts_with("image/") ? vcardUpper(type.substr(6)) : type);
    line.value = std::move(data);
    return line;
}

std::string vcardSniffMediaType(const Bytes& bytes) {
    if (startsWith(bytes, "\x89PNG\r\n")) return "image/png";
    if (startsWith(bytes, "\xFF\xD8\xFF")) return "image/jpeg";
    if (startsWith(bytes, "GIF8")) return "image/gif";
    if (startsWith(bytes, "RIFF") && startsWith(bytes, "WEBP", 8)) return "image/webp";
    return "";
}

std::string vcardDerivedFormattedName(const Dictionary& person) {
    std::string organization = textOf(person, kCXOrganizationProperty);
    if (person[kCXIsCompanyProperty].boolean() && !organization.empty()) return organization;
    std::string name;
    for (const char* key :
         {kCXTitleProperty, kCXFirstNameProperty, kCXMiddleNameProperty, kCXLastNameProperty, kCXSuffixProperty}) {
        std::string part = textOf(person, key);
        if (!part.empty()) (name += name.empty() ? "" : " ") += part;
    }
    if (!name.empty()) return name;
    if (!organization.empty()) return organization;
    std::string nickname = textOf(person, kCXNicknameProperty);
    if (!nickname.empty()) return nickname;
    std::string mail = firstValueOf(person, kCXEmailProperty);
    return mail.empty() ? firstValueOf(person, kCXPhoneProperty) : mail;
}

bool vcardIsUUID(std::string_view t) {
    if (t.size() != 36) return false;
    for (size_t i = 0; i < t.size(); i++) {
        bool hyphen = i == 8 || i == 13 || i == 18 || i == 23;
        char c = t[i];
        bool hex = (c >= '0' && c <= '9') || (c >= 'a' && c <= 'f') || (c >= 'A' && c <= 'F');
        if (hyphen ? c != '-' : !hex) return false;
    }
    return true;
}

std::string vcardUUIDForUID(std::string_view uid) {
    std::string_view bare = vcardLower(uid.substr(0, 9)) == "urn:uuid:" ? uid.substr(9) : uid;
    if (vcardIsUUID(bare)) return std::string(bare);
    // The namespace of these names, a UUID made for the purpose.
    std::string text = "\x8b\x1d\x5c\x20\x66\x1e\x4f\x02\x9a\x47\x5d\x3c\x70\x11\xe4\x93";
    text += uid;
    std::array<unsigned char, EVP_MAX_MD_SIZE> h{};
    unsigned length = 0;
    EVP_Digest(text.data(), text.size(), h.data(), &length, EVP_sha1(), nullptr);
    h[6] = static_cast<unsigned char>((h[6] & 0x0F) | 0x50);
    h[8] = static_cast<unsigned char>((h[8] & 0x3F) | 0x80);
    std::string out;
    for (size_t i = 0; i < 16; i++) {
        if (i == 4 || i == 6 || i == 8 || i == 10) out += '-';
        out += "0123456789ABCDEF"[h[i] >> 4];
        out += "0123456789ABCDEF"[h[i] & 15];
    }
    return out;
}

} // namespace rolvane
