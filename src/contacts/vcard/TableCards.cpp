#include "contacts/vcard/TableCards.h"

#include "contacts/records/CXMultiValue.h"
#include "contacts/records/Constants.h"
#include "contacts/vcard/TableColumns.h"
#include "contacts/vcard/TableText.h"
#include "contacts/vcard/VCardFields.h"
#include "contacts/vcard/VCardText.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <map>
#include <set>

namespace rolvane {

namespace {

std::string trimmed(const std::string& text) {
    return std::string(vcardTrim(text));
}

std::vector<std::string> splitAt(const std::string& text, std::string_view separator) {
    std::vector<std::string> parts;
    size_t start = 0;
    while (true) {
        const size_t end = text.find(separator, start);
        std::string part = trimmed(text.substr(start, end == std::string::npos ? end : end - start));
        if (!part.empty()) parts.push_back(std::move(part));
        if (end == std::string::npos) return parts;
        start = end + separator.size();
    }
}

// Numbers between dots or slashes: "31.12.1980", "12/31/1980".
std::optional<std::array<int, 3>> threeNumbers(const std::string& text, char separator) {
    std::array<int, 3> n{};
    size_t at = 0;
    for (const char c : text) {
        if (c == separator)
            at++;
        else if (c >= '0' && c <= '9' && at < 3 && n[at] < 1000)
            n[at] = n[at] * 10 + (c - '0');
        else
            return std::nullopt;
        if (at > 2) return std::nullopt;
    }
    return at == 2 ? std::optional(n) : std::nullopt;
}

std::optional<Date> dayOf(int year, int month, int day) {
    char text[40];
    std::snprintf(text, sizeof text, "%04d%02d%02d", year, month, day);
    return vcardDecodeDate(text);
}

// A column of dates with slashes has the day first when one of them could not be otherwise.
bool dayComesFirst(const std::vector<TableRow>& rows, size_t column) {
    for (const auto& row : rows)
        if (column < row.cells.size())
            if (const auto n = threeNumbers(trimmed(row.cells[column]), '/'); n && (*n)[0] > 12) return true;
    return false;
}

std::optional<Date> dateOf(const std::string& cell, bool dayFirst) {
    if (const auto date = vcardDecodeDate(cell)) return date;
    if (const auto n = threeNumbers(cell, '.')) return dayOf((*n)[2], (*n)[1], (*n)[0]);
    if (const auto n = threeNumbers(cell, '/')) return dayOf((*n)[2], (*n)[dayFirst ? 1 : 0], (*n)[dayFirst ? 0 : 1]);
    return std::nullopt;
}

bool isEmptyDate(const std::string& cell) {
    return cell == "0/0/00" || cell == "0/0/0000" || cell == "00/00/00" || cell == "0.0.00";
}

// Cells that programs fill in for everybody.
bool saysNothing(const std::string& header, const std::string& cell) {
    const std::string h = vcardLower(header), c = vcardLower(cell);
    return (h == "gender" && c == "unspecified") || (h == "priority" && c == "normal") ||
           (h == "sensitivity" && c == "normal") || (h == "private" && (c == "false" || c == "falsch"));
}

// Makes one person of what a row or an entry says.
class PersonMaker {
public:
    void setText(const std::string& property, const std::string& value) {
        if (!_person[property])
            _person.set(property, value);
        else if (_person[property].string() != value)
            addNote(property, value);
    }
    void addEntry(const std::string& property, Value value, const std::string& label) {
        _multi[property].addValue(std::move(value), label);
    }
    void setAddressPart(const std::string& place, const std::string& label, const std::string& key,
                        const std::string& value) {
        auto& [itsLabel, parts] = _addresses[place];
        if (!label.empty()) itsLabel = label;
        const std::string before = parts[key].string();
        parts.set(key, before.empty() ? value : before + "\n" + value);
    }
    void labelAddress(const std::string& place, const std::string& label) { _addresses[place].first = label; }
    void setDate(const std::string& property, Date date) { _person.set(property, date); }
    void addNote(const std::string& header, const std::string& value) { _kept += header + ": " + value + "\n"; }
    void note(const std::string& text) { _note += (_note.empty() ? "" : "\n") + text; }
    void setBirthParts(int year, int month, int day) { _birth = {year, month, day}; }

    VCardEntity entity(size_t line) {
        finishBirthday();
        for (auto& [place, address] : _addresses)
            if (!address.second.empty()) addEntry(kCXAddressProperty, address.second, address.first);
        for (auto& [property, values] : _multi) _person.set(property, values.toValue());
        if (!_kept.empty()) {
            _kept.pop_back();
            note(_kept);
        }
        if (!_note.empty()) _person.set(kCXNoteProperty, _note);
        const Value& formatted = _person[kCXFormattedNameProperty];
        if (formatted && formatted.string() == vcardDerivedFormattedName(_person))
            _person.remove(kCXFormattedNameProperty);
        VCardEntity card;
        card.properties = std::move(_person);
        card.categories = std::move(categories);
        card.line = line;
        return card;
    }

    std::vector<std::string> categories;

private:
    void finishBirthday() {
        const auto [year, month, day] = _birth;
        if (month == 0 && day == 0 && year == 0) return;
        if (const auto date = dayOf(year, month, day)) return _person.set(kCXBirthdayProperty, *date);
        char text[40] = "";
        if (month > 0 && day > 0 && year == 0)
            std::snprintf(text, sizeof text, "--%02d%02d", month, day);
        else
            std::snprintf(text, sizeof text, "%d-%d-%d", year, month, day);
        _person.set(kCXBirthdayTextProperty, text);
    }

    Dictionary _person;
    std::map<std::string, CXMutableMultiValue> _multi;
    std::map<std::string, std::pair<std::string, Dictionary>> _addresses; // label and parts, by place
    std::string _note, _kept;
    std::array<int, 3> _birth{0, 0, 0};
};

class TableReader {
public:
    explicit TableReader(std::vector<TableRow> rows) : _rows(std::move(rows)) {}

    TableCards read() {
        if (_rows.empty()) return {};
        _headers = std::move(_rows.front().cells);
        _rows.erase(_rows.begin());
        for (size_t i = 0; i < _headers.size(); i++) {
            _headers[i] = trimmed(_headers[i]);
            _columns.push_back(columnOf(_headers[i]));
            _dayFirst.push_back(dayComesFirst(_rows, i));
        }
        for (const auto& row : _rows) takeRow(row);
        return std::move(_result);
    }

private:
    void takeRow(const TableRow& row) {
        PersonMaker person;
        _labels.clear();
        _birth = {0, 0, 0};
        for (size_t i = 0; i < row.cells.size() && i < _columns.size(); i++)
            if (_columns[i].kind == ColumnKind::entryLabel && !trimmed(row.cells[i]).empty())
                _labels[{_columns[i].property, _columns[i].group}] = labelOfCell(row.cells[i]);
        for (size_t i = 0; i < row.cells.size(); i++) {
            const std::string cell = trimmed(row.cells[i]);
            if (cell.empty()) continue;
            if (!vcardIsPlainText(cell))
                _result.notices.push_back({row.line, "a cell with a control character", true});
            else if (i >= _columns.size())
                person.addNote("Column " + std::to_string(i + 1), cell);
            else
                takeCell(person, row, i, cell);
        }
        person.setBirthParts(_birth[0], _birth[1], _birth[2]);
        VCardEntity card = person.entity(row.line);
        if (!card.properties.empty()) _result.cards.push_back(std::move(card));
    }

    void takeCell(PersonMaker& person, const TableRow& row, size_t i, const std::string& cell) {
        const Column& column = _columns[i];
        switch (column.kind) {
        case ColumnKind::text: return person.setText(column.property, cell);
        case ColumnKind::entry: return person.addEntry(column.property, cell, column.label);
        case ColumnKind::addressPart: return takeAddressPart(person, column, cell);
        case ColumnKind::entryValue: return takeEntry(person, i, column, cell);
        case ColumnKind::note: return person.note(cell);
        case ColumnKind::date:
        case ColumnKind::dateEntry: return takeDate(person, row, i, cell);
        case ColumnKind::birthYear: _birth[0] = std::atoi(cell.c_str()); return;
        case ColumnKind::birthMonth: _birth[1] = std::atoi(cell.c_str()); return;
        case ColumnKind::birthDay: _birth[2] = std::atoi(cell.c_str()); return;
        case ColumnKind::categories: return takeCategories(person, cell);
        case ColumnKind::entryLabel:
        case ColumnKind::company:
        case ColumnKind::saysNothing: return;
        case ColumnKind::unknown: break;
        }
        if (!saysNothing(_headers[i], cell)) keepInNote(person, _headers[i], cell);
    }

    void keepInNote(PersonMaker& person, const std::string& header, const std::string& cell) {
        person.addNote(header, cell);
        if (_noted.insert(header).second) _result.intoTheNote.push_back(header);
    }

    std::string labelFor(const Column& column) const {
        const auto found = _labels.find({column.property, column.group});
        return found == _labels.end() ? std::string() : found->second;
    }

    void takeAddressPart(PersonMaker& person, const Column& column, const std::string& cell) {
        const std::string label = column.group > 0 ? labelFor(column) : column.label;
        const std::string place = column.group > 0 ? std::to_string(column.group) : column.label;
        person.setAddressPart(place, label, column.key, cell);
    }

    // Several values of one column stand behind one another.
    void takeEntry(PersonMaker& person, size_t i, const Column& column, const std::string& cell) {
        for (const std::string& value : splitAt(cell, " ::: ")) {
            if (column.property != kCXOtherDatesProperty) {
                person.addEntry(column.property, value, labelFor(column));
                continue;
            }
            if (const auto date = dateOf(value, _dayFirst[i]))
                person.addEntry(column.property, *date, labelFor(column));
            else
                keepInNote(person, labelFor(column).empty() ? _headers[i] : labelFor(column), value);
        }
    }

    void takeDate(PersonMaker& person, const TableRow& row, size_t i, const std::string& cell) {
        if (isEmptyDate(cell)) return;
        const auto date = dateOf(cell, _dayFirst[i]);
        const Column& column = _columns[i];
        if (!date && column.kind == ColumnKind::date) {
            const std::string day = vcardDayOfYear(cell[0] == ' ' ? cell.substr(1) : cell);
            return person.setText(kCXBirthdayTextProperty, day.empty() ? cell : day);
        }
        if (!date) return keepInNote(person, _headers[i], cell);
        const auto slashes = threeNumbers(cell, '/');
        if (slashes && !_dayFirst[i] && (*slashes)[1] <= 12 && _warned.insert(i).second)
            _result.notices.push_back({row.line, "the dates of " + _headers[i] + " are read as month/day/year"});
        if (column.kind == ColumnKind::date)
            person.setDate(column.property, *date);
        else
            person.addEntry(column.property, *date, column.label);
    }

    void takeCategories(PersonMaker& person, const std::string& cell) {
        const bool threeColons = cell.find(" ::: ") != std::string::npos;
        for (std::string name : splitAt(cell, threeColons ? " ::: " : ";")) {
            // "* myContacts" is everybody.
            if (name.starts_with("* ")) name.erase(0, 2);
            if (vcardLower(name) != "mycontacts") person.categories.push_back(name);
        }
    }

    std::vector<TableRow> _rows;
    std::vector<std::string> _headers;
    std::vector<Column> _columns;
    std::vector<bool> _dayFirst;
    std::map<std::pair<std::string, int>, std::string> _labels; // of the row
    std::array<int, 3> _birth{0, 0, 0};
    std::set<std::string> _noted;
    std::set<size_t> _warned;
    TableCards _result;
};

// LDIF attributes as address books name them, and the column that says the same.
const std::map<std::string, const char*>& ldifColumns() {
    static const std::map<std::string, const char*> all{
        {"givenname", "first name"},
        {"sn", "last name"},
        {"cn", "display name"},
        {"mozillanickname", "nickname"},
        {"xmozillanickname", "nickname"},
        {"mail", "primary email"},
        {"mozillasecondemail", "secondary email"},
        {"nsaimid", "screen name"},
        {"telephonenumber", "work phone"},
        {"homephone", "home phone"},
        {"fax", "fax number"},
        {"facsimiletelephonenumber", "fax number"},
        {"pager", "pager number"},
        {"mobile", "mobile number"},
        {"cellphone", "mobile number"},
        {"homestreet", "home address"},
        {"mozillahomestreet", "home address"},
        {"mozillahomestreet2", "home address 2"},
        {"mozillahomelocalityname", "home city"},
        {"mozillahomestate", "home state"},
        {"mozillahomepostalcode", "home zipcode"},
        {"mozillahomecountryname", "home country"},
        {"street", "work address"},
        {"mozillaworkstreet2", "work address 2"},
        {"l", "work city"},
        {"locality", "work city"},
        {"st", "work state"},
        {"postalcode", "work zipcode"},
        {"c", "work country"},
        {"title", "job title"},
        {"ou", "department"},
        {"department", "department"},
        {"o", "organization"},
        {"company", "organization"},
        {"mozillaworkurl", "web page 1"},
        {"workurl", "web page 1"},
        {"mozillahomeurl", "web page 2"},
        {"homeurl", "web page 2"},
        {"birthyear", "birth year"},
        {"birthmonth", "birth month"},
        {"birthday", "birth day"},
        {"description", "notes"},
        {"notes", "notes"},
    };
    return all;
}

// A URI of RFC 4516, by which the groups of the text name the entry.
std::string uidOf(const std::string& dn) {
    return "ldap:///" + dn;
}

bool isGroup(const LdifEntry& entry) {
    for (const auto& [name, value] : entry.attributes)
        if (name == "objectclass" && vcardLower(value).starts_with("groupofn")) return true;
    return false;
}

VCardEntity groupOf(const LdifEntry& entry) {
    VCardEntity group;
    group.isGroup = true;
    group.line = entry.line;
    group.uid = uidOf(entry.dn);
    const std::string name = entry.first("cn");
    group.properties.set(kCXGroupNameProperty, name.empty() ? entry.dn : name);
    if (const std::string note = entry.first("description"); !note.empty()) group.properties.set(kCXNoteProperty, note);
    for (const auto& [key, value] : entry.attributes)
        if (key == "member") group.members.push_back(uidOf(value));
    return group;
}

} // namespace

TableKind tableKindOf(std::string_view start) {
    const std::string text = vcardUpper(start);
    if (text.find("BEGIN:VCARD") != std::string::npos) return TableKind::none;
    size_t line = text.starts_with("\xEF\xBB\xBF") ? 3 : 0;
    while (line < text.size()) { // comments and the version may stand before the first entry
        std::string_view rest = std::string_view(text).substr(line);
        if (rest.starts_with("DN:")) return TableKind::ldif;
        const bool passed =
            rest.starts_with('#') || rest.starts_with("VERSION:") || rest.starts_with('\n') || rest.starts_with('\r');
        if (!passed) break;
        line = std::min(text.find('\n', line), text.size() - 1) + 1;
    }
    const auto rows = tableRows(start);
    return !rows.empty() && isHeaderOfPeople(rows.front().cells) ? TableKind::table : TableKind::none;
}

TableCards cardsOfTable(std::string_view text) {
    return TableReader(tableRows(text)).read();
}

TableCards cardsOfLdif(std::string_view text) {
    // Each entry is a row with a header of its own; the table's rules do the rest.
    TableCards all;
    all.namesItself = true;
    std::set<std::string> noted;
    for (const auto& entry : ldifEntries(text)) {
        if (!entry.damaged.empty())
            all.notices.push_back({entry.line, "\"" + entry.damaged + "\" is no attribute", true});
        if (isGroup(entry)) {
            all.cards.push_back(groupOf(entry));
            continue;
        }
        TableRow header{entry.line, {}}, row{entry.line, {}};
        for (const auto& [name, value] : entry.attributes) {
            if (name == "objectclass" || name == "modifytimestamp") continue;
            const auto known = ldifColumns().find(name);
            header.cells.push_back(known == ldifColumns().end() ? name : known->second);
            row.cells.push_back(value);
        }
        TableCards one = TableReader({header, row}).read();
        for (auto& card : one.cards) {
            card.uid = uidOf(entry.dn);
            all.cards.push_back(std::move(card));
        }
        for (const auto& name : one.intoTheNote)
            if (noted.insert(name).second) all.intoTheNote.push_back(name);
        all.notices.insert(all.notices.end(), one.notices.begin(), one.notices.end());
    }
    return all;
}

} // namespace rolvane
