#include "contacts/vcard/VCardScanner.h"

#include "contacts/vcard/VCardText.h"
#include "foundation/CXException.h"

#include <cerrno>
#include <cstring>

namespace rolvane {

namespace {

constexpr size_t kBlockBytes = 64 << 10;

bool isMark(const std::string& text, std::string_view mark) {
    // Blanks around it, and around the colon, are forgiven.
    std::string_view t = vcardTrim(text);
    size_t colon = t.find(':');
    if (colon == std::string_view::npos) return false;
    size_t markColon = mark.find(':');
    return vcardEqualNoCase(vcardTrim(t.substr(0, colon)), mark.substr(0, markColon)) &&
           vcardEqualNoCase(vcardTrim(t.substr(colon + 1)), mark.substr(markColon + 1));
}

bool isBegin(const std::string& text) {
    return isMark(text, "BEGIN:VCARD");
}
bool isEnd(const std::string& text) {
    return isMark(text, "END:VCARD");
}

std::string sizeText(size_t bytes) {
    return bytes >> 20 ? std::to_string(bytes >> 20) + " MB" : std::to_string(bytes) + " bytes";
}

bool isBlank(const std::string& text) {
    return vcardTrim(text).empty();
}

// The part of a line before its value, in capitals.
std::string headOf(const std::string& text) {
    return vcardUpper(text.substr(0, std::min<size_t>(text.find(':'), 512)));
}

// Whether the parameters before the value say that it is quoted-printable.
bool isQuotedPrintable(const std::string& text) {
    bool quoted = false;
    size_t start = std::string::npos;
    for (size_t i = 0; i < text.size(); i++) {
        if (text[i] == '"') quoted = !quoted;
        if (quoted || (text[i] != ';' && text[i] != ':')) continue;
        if (start != std::string::npos) {
            std::string parameter = vcardUpper(text.substr(start, i - start));
            size_t equals = parameter.find('=');
            std::string_view value = vcardTrim(std::string_view(parameter).substr(equals + 1)); // npos + 1 is 0
            bool encoding = equals == std::string::npos || vcardTrim(parameter.substr(0, equals)) == "ENCODING";
            if (encoding && (value == "QUOTED-PRINTABLE" || value == "\"QUOTED-PRINTABLE\"")) return true;
        }
        if (text[i] == ':') return false;
        start = i + 1;
    }
    return false;
}

// The value with its line ends as escapes. A backslash that stands alone before one is doubled, lest the two become
// one escape.
std::string withEscapedLineEnds(std::string_view value) {
    std::string out;
    bool open = false; // an odd number of backslashes stands before
    for (size_t i = 0; i < value.size(); i++) {
        char c = value[i];
        if (c == '\r' && i + 1 < value.size() && value[i + 1] == '\n') continue;
        if (c == '\n' || c == '\r')
            out += open ? "\\\\n" : "\\n";
        else
            out += c;
        open = c == '\\' && !open;
    }
    return out;
}

bool isBase64Head(const std::string& head) {
    return head.find("BASE64") != std::string::npos || head.find("ENCODING=B") != std::string::npos;
}

bool looksLikeBase64(const std::string& text) {
    if (text.size() < 16) return text.ends_with('=') && text.find(':') == std::string::npos;
    return text.find_first_not_of("ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/=") ==
           std::string::npos;
}

bool saysItsCharset(const std::string& text) {
    return headOf(text).find("CHARSET") != std::string::npos;
}

// What is read of a damaged line when it is of a person; anything else is only kept.
bool isOfPerson(std::string_view name) {
    for (std::string_view known : {"FN", "N", "NICKNAME", "ORG", "TITLE", "NOTE", "TEL", "EMAIL", "ADR", "URL"})
        if (name == known) return true;
    return false;
}

} // namespace

VCardScanner::VCardScanner(std::istream& in, std::string fileName, ErrorHandler onError, VCardLimits limits)
    : _in(in), _fileName(std::move(fileName)), _onError(std::move(onError)), _limits(limits), _block(kBlockBytes) {}

bool VCardScanner::fillBlock() {
    if (_blockStart < _blockEnd) return true;
    if (_ended) return false;
    _in.read(_block.data(), static_cast<std::streamsize>(_block.size()));
    auto n = static_cast<size_t>(_in.gcount());
    if (_in.bad()) throw CXException(kCXVCardException, _fileName + " cannot be read: " + std::strerror(errno));
    _blockStart = 0, _blockEnd = n;
    if (n < _block.size()) _ended = true;
    if (!_examined) examineStart();
    return _blockStart < _blockEnd;
}

// The first block tells the encoding and what ends a line.
void VCardScanner::examineStart() {
    _examined = true;
    std::string_view start(_block.data(), _blockEnd);
    if (start.starts_with("\xEF\xBB\xBF")) {
        _blockStart = 3;
        _bytesRead += 3;
    }
    bool mark16 = start.starts_with("\xFF\xFE") || start.starts_with("\xFE\xFF");
    bool bare16 = start.size() >= 4 && ((start[0] == 0 && start[1] == 'B') || (start[0] == 'B' && start[1] == 0));
    if (mark16 || bare16) {
        _onError({_fileName, 1, "the file is in UTF-16; save it as UTF-8 and import it again"});
        _blockStart = _blockEnd = 0;
        _ended = true;
        return;
    }
    if (start.find('\n') == std::string_view::npos && start.find('\r') != std::string_view::npos) _separator = '\r';
}

// Reads up to the end of the physical line; beyond `limit` the rest is passed over and not kept.
bool VCardScanner::readPhysical(std::string& into, size_t limit, bool& tooLong) {
    into.clear();
    tooLong = false;
    if (!fillBlock()) return false;
    _physicalNumber++;
    while (fillBlock()) {
        const char* from = _block.data() + _blockStart;
        size_t available = _blockEnd - _blockStart;
        auto* end = static_cast<const char*>(std::memchr(from, _separator, available));
        size_t n = end ? static_cast<size_t>(end - from) : available;
        if (into.size() + n > limit) {
            tooLong = true;
            n = std::min(n, limit - std::min(limit, into.size()));
        }
        into.append(from, n);
        size_t used = end ? static_cast<size_t>(end - from) + 1 : available;
        _blockStart += used;
        _bytesRead += used;
        if (end) break;
    }
    while (!into.empty() && into.back() == '\r') into.pop_back();
    return true;
}

// Whether the physical line continues the logical one; what it adds is appended by the caller after this has taken a
// soft line break off.
bool VCardScanner::continues(Unfolded& line, const std::string& next) const {
    if (line.text.ends_with('=') && isQuotedPrintable(line.text)) {
        line.text.pop_back();
        return true;
    }
    if (!next.empty() && (next[0] == ' ' || next[0] == '\t')) return true;
    return _version21 && isBase64Head(headOf(line.text)) && looksLikeBase64(next);
}

bool VCardScanner::readUnfolded(Unfolded& line) {
    line = {};
    const size_t most = _limits.lineBytes;
    if (_haveAhead) {
        line.text.swap(_ahead);
        line.tooLong = _aheadTooLong;
        _haveAhead = false;
    } else if (!readPhysical(line.text, most, line.tooLong)) {
        return false;
    }
    line.present = true;
    line.number = _physicalNumber;
    bool soft = false;
    while (readPhysical(_ahead, most, _aheadTooLong)) {
        size_t before = line.text.size();
        if (!continues(line, _ahead)) {
            _haveAhead = true;
            break;
        }
        soft = line.text.size() < before; // after a soft break a leading blank belongs to the text
        bool blank = !soft && (_ahead[0] == ' ' || _ahead[0] == '\t');
        if (_aheadTooLong || line.text.size() + _ahead.size() > most)
            line.tooLong = true;
        else
            line.text.append(_ahead, blank ? 1 : 0);
    }
    return true;
}

void VCardScanner::junk(size_t line) {
    if (!_inJunk) reject(line, "this text belongs to no card: a card begins with BEGIN:VCARD");
    _inJunk = true;
}

std::optional<VCard> VCardScanner::next() {
    while (true) {
        std::optional<size_t> begin = _pendingBegin;
        _pendingBegin.reset();
        Unfolded line;
        while (!begin) {
            if (!readUnfolded(line)) return std::nullopt;
            if (isBegin(line.text))
                begin = line.number;
            else if (!isBlank(line.text))
                junk(line.number);
        }
        _inJunk = false;
        if (auto card = readCard(*begin)) return card;
        _version21 = false;
        _inJunk = true; // what is left of a bad card has been reported with it
    }
}

std::optional<VCard> VCardScanner::readCard(size_t beginLine) {
    VCard card;
    card.firstLine = beginLine;
    _version21 = false;
    size_t bytes = 0;
    Unfolded line;
    while (readUnfolded(line)) {
        if (isEnd(line.text)) {
            _version21 = false;
            return card;
        }
        if (isBegin(line.text)) {
            bool agent = card.version == "2.1" && !card.lines.empty() && card.lines.back().name == "AGENT" &&
                         vcardTrim(card.lines.back().value).empty();
            if (agent) {
                auto nested = nestedCard();
                if (!nested) break;
                card.lines.back().value = *nested;
                continue;
            }
            reject(beginLine, "the card has no END:VCARD: another one begins inside it");
            _pendingBegin = line.number;
            return std::nullopt;
        }
        bytes += line.text.size() + kVCardLineCost;
        if (bytes > _limits.cardBytes) {
            reject(line.number, "the card is longer than " + sizeText(_limits.cardBytes));
            return std::nullopt;
        }
        if (!addLine(card, line)) return std::nullopt;
    }
    reject(beginLine, "the card has no END:VCARD: the file ends inside it");
    return std::nullopt;
}

// A vCard 2.1 AGENT holds a card as it stands; it is kept as the one text that later versions make of it.
std::optional<std::string> VCardScanner::nestedCard() {
    std::string text = "BEGIN:VCARD\n";
    Unfolded line;
    for (int depth = 1; depth > 0;) {
        if (!readUnfolded(line)) return std::nullopt;
        if (isBegin(line.text)) depth++;
        if (isEnd(line.text)) depth--;
        if (text.size() + line.text.size() > _limits.lineBytes) return std::nullopt;
        text += line.text + "\n";
    }
    text.pop_back();
    if (vcardFirstInvalidUTF8(text) || vcardHasControlCharacter(text)) return std::string();
    return vcardEscape(text);
}

bool VCardScanner::addLine(VCard& card, Unfolded& line) {
    if (line.tooLong) {
        card.notices.push_back({line.number, "the line is longer than " + sizeText(_limits.lineBytes), true});
        return true;
    }
    if (isBlank(line.text)) return true;
    std::string converted, reason;
    if (!_fallback.empty() && vcardFirstInvalidUTF8(line.text) && !saysItsCharset(line.text)) {
        converted = line.text;
        convertByFallback(converted);
    }
    auto parsed = vcardParseLine(converted.empty() ? line.text : converted, _version21, &reason);
    if (parsed) parsed->number = line.number;
    if (!parsed || !decodeLine(*parsed, reason)) return addUnread(card, line, reason), true;
    if (parsed->name == "BEGIN" || parsed->name == "END") {
        // A damaged mark: what follows may be another card's.
        reject(line.number, "the line " + parsed->name + " is neither BEGIN:VCARD nor END:VCARD");
        return false;
    }
    if (parsed->name != "VERSION") return card.lines.push_back(std::move(*parsed)), true;
    if (!setVersion(card, *parsed, reason)) return reject(line.number, reason), false;
    _version21 = card.version == "2.1";
    return true;
}

// The line as it stands, and what can be made of its value.
void VCardScanner::addUnread(VCard& card, const Unfolded& line, const std::string& reason) {
    VCardLine kept;
    kept.name = kVCardUnreadLine;
    kept.number = line.number;
    if (vcardFirstInvalidUTF8(line.text) || vcardHasControlCharacter(line.text)) {
        kept.add("X-BASE64", "1");
        kept.value = vcardEncodeBase64({line.text.begin(), line.text.end()});
    } else {
        kept.value = vcardEscape(line.text);
    }
    card.lines.push_back(std::move(kept));
    card.notices.push_back({line.number, reason});
    std::string text = line.text;
    if (vcardFirstInvalidUTF8(text) && !convertByFallback(text)) return;
    std::erase_if(text, [](char c) { return vcardHasControlCharacter(std::string_view(&c, 1)); });
    auto usable = vcardParseDamagedLine(text);
    if (!usable || !isOfPerson(usable->name)) return;
    usable->number = line.number;
    std::string second;
    if (decodeLine(*usable, second) && !vcardTrim(usable->value).empty()) card.lines.push_back(std::move(*usable));
}

bool VCardScanner::convertByFallback(std::string& text) {
    auto converted = _fallback.empty() ? std::nullopt : vcardConvertToUTF8(text, _fallback);
    if (!converted) return false;
    text = std::move(*converted);
    _fallbackLines++;
    return true;
}

bool VCardScanner::setVersion(VCard& card, const VCardLine& line, std::string& reason) const {
    std::string_view v = vcardTrim(line.value);
    if (v != "2.1" && v != "3.0" && v != "4.0") {
        reason = "the card is of version \"" + std::string(v) + "\"; 2.1, 3.0 and 4.0 can be read";
        return false;
    }
    card.version = std::string(v);
    return true;
}

// Resolves quoted-printable and CHARSET, and makes sure of the characters.
bool VCardScanner::decodeLine(VCardLine& line, std::string& reason) {
    std::string charset;
    bool decoded = false;
    std::erase_if(line.parameters, [&](const VCardParameter& p) {
        bool spent = p.name == "CHARSET";
        if (spent && !p.values.empty()) charset = p.values.front();
        if (p.name != "ENCODING" || p.values.empty()) return spent;
        const std::string& how = p.values.front();
        if (vcardEqualNoCase(how, "QUOTED-PRINTABLE")) {
            line.value = vcardDecodeQuotedPrintable(line.value);
            return decoded = true;
        }
        return vcardEqualNoCase(how, "8BIT") || vcardEqualNoCase(how, "7BIT");
    });
    bool foreign = !charset.empty() && !vcardEqualNoCase(charset, "UTF-8") && !vcardEqualNoCase(charset, "UTF8");
    if (foreign) {
        auto converted = vcardConvertToUTF8(line.value, charset);
        if (!converted) {
            reason = line.name + " cannot be converted from the character set " + charset;
            return false;
        }
        line.value = std::move(*converted);
        decoded = true;
    } else if (vcardFirstInvalidUTF8(line.value)) {
        convertByFallback(line.value);
    }
    // A decoded line end is text; in the value of a content line it is written as an escape.
    if (decoded && line.value.find_first_of("\r\n") != std::string::npos) line.value = withEscapedLineEnds(line.value);
    auto clean = [&](const std::string& s) {
        if (vcardFirstInvalidUTF8(s))
            reason = "the text is not UTF-8";
        else if (vcardHasControlCharacter(s))
            reason = "the text has a control character";
        return reason.empty();
    };
    bool good = clean(line.value);
    for (const auto& p : line.parameters)
        for (const auto& v : p.values) good = good && clean(v);
    return good;
}

} // namespace rolvane
