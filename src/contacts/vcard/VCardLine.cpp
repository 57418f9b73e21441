#include "contacts/vcard/VCardLine.h"

#include "contacts/vcard/VCardText.h"

#include <algorithm>

namespace rolvane {

namespace {

bool isNameCharacter(char c) {
    return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '-' || c == '_' ||
           c == '/'; // the last two are no part of the grammar, but are met
}

std::string resolveCarets(std::string_view s) {
    std::string out;
    out.reserve(s.size());
    for (size_t i = 0; i < s.size(); i++) {
        char next = s[i] == '^' && i + 1 < s.size() ? s[i + 1] : '\0';
        if (next == 'n' || next == '^' || next == '\'') {
            out += next == 'n' ? '\n' : next == '^' ? '^' : '"';
            i++;
        } else {
            out += s[i];
        }
    }
    return out;
}

std::string parameterNameOfWord(std::string_view word) {
    for (const char* encoding : {"QUOTED-PRINTABLE", "BASE64", "8BIT", "7BIT", "B"})
        if (vcardEqualNoCase(word, encoding)) return "ENCODING";
    for (const char* place : {"INLINE", "URL", "CONTENT-ID", "CID"})
        if (vcardEqualNoCase(word, place)) return "VALUE";
    return "TYPE";
}

// Walks over one content line.
class Parser {
public:
    Parser(std::string_view text, bool version21) : _t(text), _v21(version21) {}

    std::optional<VCardLine> parse() {
        VCardLine line;
        const std::string_view first = groupAndName(line);
        if (first.empty()) return fail("the line does not begin with a property name");
        line.name = vcardUpper(first);
        while (at(';')) {
            _i++;
            if (!parameter(line)) return std::nullopt;
        }
        if (!at(':')) return fail("the line has no colon between property and value");
        line.value = std::string(_t.substr(_i + 1));
        return line;
    }

    // Parameters that cannot be read are passed over.
    std::optional<VCardLine> parseDamaged() {
        VCardLine line;
        const std::string_view first = groupAndName(line);
        line.name = vcardUpper(first);
        while (!first.empty() && at(';')) {
            const size_t start = ++_i;
            const VCardLine before = line;
            if (parameter(line) && (at(';') || at(':'))) continue;
            line = before;
            _i = start;
            takeBracketed(line, passParameter());
        }
        if (first.empty() || !at(':')) return std::nullopt;
        line.value = std::string(_t.substr(_i + 1));
        return line;
    }

    std::string reason;

private:
    // The text of a parameter up to the next one or the value; what stands in brackets belongs to it.
    std::string_view passParameter() {
        const size_t start = _i;
        for (int depth = 0; _i < _t.size(); _i++) {
            const char c = _t[_i];
            if (c == '(') depth++;
            if (c == ')') depth--;
            if (depth <= 0 && (c == ';' || c == ':')) break;
        }
        if (_i == _t.size()) _i = std::min(_t.find_first_of(";:", start), _t.size()); // a bracket that nothing closes
        return _t.substr(start, _i - start);
    }

    static void takeBracketed(VCardLine& line, std::string_view text) {
        const size_t open = text.find('('), close = text.rfind(')');
        if (open == std::string_view::npos || close == std::string_view::npos || close < open) return;
        if (!vcardEqualNoCase(text.substr(0, open), "X-CUSTOM")) return;
        const std::string_view inside = text.substr(open + 1, close - open - 1);
        const size_t comma = inside.rfind(',');
        std::string label(inside.substr(comma == std::string_view::npos ? 0 : comma + 1));
        if (vcardUpper(inside).find("QUOTED-PRINTABLE") != std::string::npos) label = vcardDecodeQuotedPrintable(label);
        if (!label.empty() && !vcardFirstInvalidUTF8(label) && !vcardHasControlCharacter(label))
            line.add("TYPE", label);
    }

    bool at(char c) const { return _i < _t.size() && _t[_i] == c; }

    std::nullopt_t fail(const char* why) {
        reason = why;
        return std::nullopt;
    }

    // Takes the group, where there is one, into the line; the property's name.
    std::string_view groupAndName(VCardLine& line) {
        const std::string_view first = name();
        if (!at('.')) return first;
        _i++;
        line.group = std::string(first);
        return name();
    }

    std::string_view name() {
        size_t start = _i;
        while (_i < _t.size() && isNameCharacter(_t[_i])) _i++;
        return _t.substr(start, _i - start);
    }

    void blanks() {
        while (at(' ') || at('\t')) _i++;
    }

    bool parameter(VCardLine& line) {
        blanks();
        if (at(';') || at(':')) return true; // an empty parameter says nothing
        std::string_view word = name();
        blanks();
        if (word.empty()) {
            reason = "a parameter has no name";
            return false;
        }
        if (!at('=')) {
            line.add(parameterNameOfWord(word), std::string(word));
            return at(';') || at(':') || missingColon();
        }
        _i++;
        std::string key = vcardUpper(word);
        do {
            if (at(',')) _i++;
            if (!parameterValue(line, key)) return false;
        } while (at(','));
        return true;
    }

    bool missingColon() {
        reason = "the line has no colon between property and value";
        return false;
    }

    bool parameterValue(VCardLine& line, const std::string& key) {
        std::string_view raw;
        if (at('"')) {
            size_t end = _t.find('"', _i + 1);
            if (end == std::string_view::npos) {
                reason = "a quoted parameter value has no closing quotation mark";
                return false;
            }
            raw = _t.substr(_i + 1, end - _i - 1);
            _i = end + 1;
            if (_i < _t.size() && _t[_i] != ',' && _t[_i] != ';' && _t[_i] != ':') {
                reason = "text follows the closing quotation mark of a parameter value";
                return false;
            }
        } else {
            size_t end = _t.find_first_of(";:,", _i);
            if (end == std::string_view::npos) return missingColon();
            raw = vcardTrim(_t.substr(_i, end - _i));
            _i = end;
        }
        line.add(key, _v21 ? std::string(raw) : resolveCarets(raw));
        return true;
    }

    std::string_view _t;
    bool _v21;
    size_t _i = 0;
};

std::string formatParameterValue(const std::string& value) {
    std::string out;
    bool quote = value.empty();
    for (size_t i = 0; i < value.size(); i++) {
        char c = value[i];
        if (c == '^')
            out += "^^";
        else if (c == '\n')
            out += "^n";
        else if (c == '"')
            out += "^'";
        else
            out += c;
        if (c == ',' || c == ';' || c == ':' || ((c == ' ' || c == '\t') && (i == 0 || i + 1 == value.size())))
            quote = true;
    }
    return quote ? '"' + out + '"' : out;
}

} // namespace

const VCardParameter* VCardLine::parameter(std::string_view parameterName) const {
    for (const auto& p : parameters)
        if (vcardEqualNoCase(p.name, parameterName)) return &p;
    return nullptr;
}

std::string VCardLine::firstValueOf(std::string_view parameterName) const {
    const VCardParameter* p = parameter(parameterName);
    return p && !p->values.empty() ? p->values.front() : std::string();
}

std::vector<std::string> VCardLine::types() const {
    std::vector<std::string> out;
    for (const auto& p : parameters) {
        if (p.name != "TYPE") continue;
        // RFC 6350 writes TYPE="voice,home" in its own examples: one quoted text that holds a list.
        for (const auto& v : p.values)
            for (auto part : vcardSplit(v, ',')) out.push_back(vcardLower(vcardTrim(part)));
    }
    return out;
}

bool VCardLine::hasType(std::string_view type) const {
    for (const auto& t : types())
        if (vcardEqualNoCase(t, type)) return true;
    return false;
}

bool VCardLine::isStillEncoded() const {
    if (parameter("CHARSET")) return true;
    std::string encoding = firstValueOf("ENCODING");
    for (const char* e : {"QUOTED-PRINTABLE", "8BIT", "7BIT"})
        if (vcardEqualNoCase(encoding, e)) return true;
    return false;
}

void VCardLine::add(std::string_view parameterName, std::string parameterValue) {
    for (auto& p : parameters) {
        if (p.name != parameterName) continue;
        p.values.push_back(std::move(parameterValue));
        return;
    }
    parameters.push_back({std::string(parameterName), {std::move(parameterValue)}});
}

std::optional<VCardLine> vcardParseLine(std::string_view text, bool version21, std::string* reason) {
    Parser parser(text, version21);
    auto line = parser.parse();
    if (!line && reason) *reason = parser.reason;
    return line;
}

std::optional<VCardLine> vcardParseDamagedLine(std::string_view text) {
    return Parser(text, true).parseDamaged();
}

std::string vcardFormatLine(const VCardLine& line) {
    std::string out;
    out.reserve(line.value.size() + 64);
    if (!line.group.empty()) (out += line.group) += '.';
    out += line.name;
    for (const auto& p : line.parameters) {
        (out += ';') += p.name;
        char separator = '=';
        for (const auto& v : p.values) {
            out += separator;
            out += formatParameterValue(v);
            separator = ',';
        }
    }
    out += ':';
    for (size_t i = 0; i < line.value.size(); i++) {
        char c = line.value[i];
        if (c == '\r' && i + 1 < line.value.size() && line.value[i + 1] == '\n') continue;
        if (c == '\n' || c == '\r')
            out += "\\n"; // a raw line end would end the line
        else
            out += c;
    }
    return out;
}

void vcardAppendFolded(std::string& out, std::string_view unfolded) {
    size_t room = 75;
    while (unfolded.size() > room) {
        size_t cut = room;
        while (cut > 0 && (static_cast<unsigned char>(unfolded[cut]) & 0xC0) == 0x80) cut--;
        if (cut == 0) cut = room; // no UTF-8 at all
        out.append(unfolded.substr(0, cut)).append("\r\n ");
        unfolded.remove_prefix(cut);
        room = 74; // the leading space counts
    }
    out.append(unfolded).append("\r\n");
}

std::string vcardEscape(std::string_view text) {
    std::string out;
    out.reserve(text.size() + 8);
    for (size_t i = 0; i < text.size(); i++) {
        char c = text[i];
        if (c == '\\' || c == ',' || c == ';')
            (out += '\\') += c;
        else if (c == '\n')
            out += "\\n";
        else if (c != '\r')
            out += c;
        else if (i + 1 == text.size() || text[i + 1] != '\n')
            out += "\\n";
    }
    return out;
}

std::string vcardUnescape(std::string_view text) {
    std::string out;
    out.reserve(text.size());
    for (size_t i = 0; i < text.size(); i++) {
        char next = text[i] == '\\' && i + 1 < text.size() ? text[i + 1] : '\0';
        if (next == 'n' || next == 'N') {
            out += '\n';
            i++;
        } else if (next == '\\' || next == ',' || next == ';' || next == ':') {
            out += next;
            i++;
        } else {
            out += text[i];
        }
    }
    return out;
}

std::vector<std::string_view> vcardSplit(std::string_view value, char separator) {
    std::vector<std::string_view> parts;
    size_t start = 0;
    for (size_t i = 0; i < value.size(); i++) {
        if (value[i] == '\\')
            i++;
        else if (value[i] == separator) {
            parts.push_back(value.substr(start, i - start));
            start = i + 1;
        }
    }
    parts.push_back(value.substr(start));
    return parts;
}

} // namespace rolvane
