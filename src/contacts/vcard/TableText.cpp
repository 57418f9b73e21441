#include "contacts/vcard/TableText.h"

#include "contacts/vcard/VCardText.h"

#include <algorithm>

namespace rolvane {

namespace {

char separatorOf(std::string_view text) {
    size_t counts[3] = {0, 0, 0};
    bool quoted = false;
    for (const char c : text) {
        if (c == '"') quoted = !quoted;
        if (quoted) continue;
        if (c == '\n') break;
        if (c == ',') counts[0]++;
        if (c == ';') counts[1]++;
        if (c == '\t') counts[2]++;
    }
    const size_t most = static_cast<size_t>(std::max_element(counts, counts + 3) - counts);
    return ",;\t"[most];
}

std::string_view withoutByteOrderMark(std::string_view text) {
    return text.starts_with("\xEF\xBB\xBF") ? text.substr(3) : text;
}

// Cuts a table into cells.
class Cells {
public:
    explicit Cells(std::string_view text) : _t(text), _separator(separatorOf(text)) {}

    std::vector<TableRow> rows() {
        while (_i < _t.size()) {
            TableRow row{_line, {}};
            do row.cells.push_back(cell());
            while (_i < _t.size() && _t[_i++] == _separator);
            const bool blank = std::all_of(row.cells.begin(), row.cells.end(),
                                           [](const std::string& c) { return vcardTrim(c).empty(); });
            if (!blank) _rows.push_back(std::move(row));
        }
        return std::move(_rows);
    }

private:
    // Ends before the separator or the line feed behind it.
    std::string cell() {
        std::string text;
        bool quoted = _i < _t.size() && _t[_i] == '"';
        if (quoted) _i++;
        for (; _i < _t.size(); _i++) {
            const char c = _t[_i];
            if (quoted && c == '"') {
                if (_i + 1 < _t.size() && _t[_i + 1] == '"') {
                    text += _t[++_i];
                    continue;
                }
                quoted = false;
                continue;
            }
            if (!quoted && (c == _separator || c == '\n')) break;
            if (c == '\r' && _i + 1 < _t.size() && _t[_i + 1] == '\n') continue;
            if (c == '\n') _line++;
            text += c;
        }
        if (_i < _t.size() && _t[_i] == '\n') _line++;
        return text;
    }

    std::string_view _t;
    char _separator;
    size_t _i = 0, _line = 1;
    std::vector<TableRow> _rows;
};

void takeLdifLine(LdifEntry& entry, const std::string& line) {
    const size_t colon = line.find(':');
    if (colon == std::string::npos || colon == 0) {
        entry.damaged = line;
        return;
    }
    const std::string name = vcardLower(line.substr(0, colon));
    const bool base64 = line.size() > colon + 1 && line[colon + 1] == ':';
    std::string value(vcardTrim(std::string_view(line).substr(colon + (base64 ? 2 : 1))));
    if (base64) {
        const auto bytes = vcardDecodeBase64(value);
        if (!bytes) {
            entry.damaged = line;
            return;
        }
        value.assign(bytes->begin(), bytes->end());
    }
    if (name == "dn")
        entry.dn = value;
    else
        entry.attributes.emplace_back(name, std::move(value));
}

} // namespace

std::vector<TableRow> tableRows(std::string_view text) {
    return Cells(withoutByteOrderMark(text)).rows();
}

std::string LdifEntry::first(std::string_view name) const {
    for (const auto& [key, value] : attributes)
        if (key == name) return value;
    return "";
}

std::vector<LdifEntry> ldifEntries(std::string_view text) {
    text = withoutByteOrderMark(text);
    std::vector<LdifEntry> entries;
    LdifEntry entry;
    std::string unfolded;
    size_t number = 0;
    const auto take = [&] {
        const bool comment = unfolded.starts_with('#') || vcardLower(unfolded.substr(0, 8)) == "version:";
        if (!unfolded.empty() && !comment) takeLdifLine(entry, unfolded);
        unfolded.clear();
    };
    const auto end = [&] {
        take();
        if (!entry.dn.empty() || !entry.attributes.empty()) entries.push_back(std::move(entry));
        entry = {};
    };
    while (!text.empty()) {
        const size_t feed = std::min(text.find('\n'), text.size());
        std::string_view line = text.substr(0, feed);
        text.remove_prefix(std::min(feed + 1, text.size()));
        number++;
        if (line.ends_with('\r')) line.remove_suffix(1);
        if (line.starts_with(' ')) {
            unfolded += line.substr(1);
        } else if (line.empty()) {
            end();
        } else {
            take();
            if (entry.line == 0) entry.line = number;
            unfolded = line;
        }
    }
    end();
    return entries;
}

} // namespace rolvane
