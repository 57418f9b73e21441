#include "contacts/records/RecordKind.h"

#include "contacts/records/CXMultiValue.h"
#include "contacts/records/CXPerson.h"
#include "contacts/records/SearchText.h"

#include <array>
#include <clocale>
#include <cwctype>
#include <libintl.h>

namespace rolvane {

namespace {

struct NamedKind {
    std::string_view table;
    RecordKind kind;
};
constexpr std::array<NamedKind, 10> kTables{{{kCXPersonTable, RecordKind::person},
                                             {kCXSubscribedPersonTable, RecordKind::subscribedPerson},
                                             {kCXGroupTable, RecordKind::group},
                                             {kCXSubscribedGroupTable, RecordKind::subscribedGroup},
                                             {kCXAllGroupUID, RecordKind::allGroup},
                                             {kCXAllSubscribedGroupTable, RecordKind::allSubscribedGroup},
                                             {kCXSubscriptionTable, RecordKind::subscription},
                                             {kCXGroupContentsTable, RecordKind::groupContents},
                                             {kCXSubscribedGroupContentsTable, RecordKind::groupContents},
                                             {kCXInfoTable, RecordKind::info}}};

void append(std::string& text, const Value& value) {
    if (!value.isString() || value.string().empty()) return;
    if (!text.empty()) text += ' ';
    text += value.string();
}

std::string sortText(const Dictionary& p) {
    std::string text;
    append(text, p[kCXLastNameProperty]);
    append(text, p[kCXFirstNameProperty]);
    append(text, p[kCXMiddleNameProperty]);
    return text.empty() ? cxDisplayName(p) : text;
}

locale_t utf8Locale() {
    static locale_t locale = newlocale(LC_CTYPE_MASK, "C.UTF-8", nullptr);
    return locale;
}

void appendUTF8(std::string& out, char32_t c) {
    if (c < 0x80) {
        out += static_cast<char>(c);
    } else if (c < 0x800) {
        out += static_cast<char>(0xC0 | (c >> 6));
        out += static_cast<char>(0x80 | (c & 0x3F));
    } else if (c < 0x10000) {
        out += static_cast<char>(0xE0 | (c >> 12));
        out += static_cast<char>(0x80 | ((c >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (c & 0x3F));
    } else {
        out += static_cast<char>(0xF0 | (c >> 18));
        out += static_cast<char>(0x80 | ((c >> 12) & 0x3F));
        out += static_cast<char>(0x80 | ((c >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (c & 0x3F));
    }
}

// The length of the sequence at `i` and its code point; length 1 and the byte itself when it is malformed.
std::pair<size_t, char32_t> codePoint(std::string_view s, size_t i) {
    auto byte = [&](size_t k) { return static_cast<unsigned char>(s[k]); };
    unsigned char first = byte(i);
    size_t length = first < 0x80 ? 1 : (first >> 5) == 6 ? 2 : (first >> 4) == 14 ? 3 : (first >> 3) == 30 ? 4 : 0;
    if (length == 0 || i + length > s.size()) return {0, first};
    if (length == 1) return {1, first};
    char32_t c = first & (0xFF >> (length + 1));
    for (size_t k = 1; k < length; k++) {
        if ((byte(i + k) & 0xC0) != 0x80) return {0, first};
        c = (c << 6) | (byte(i + k) & 0x3F);
    }
    return {length, c};
}

} // namespace

RecordKind kindOfTable(std::string_view table) {
    for (const NamedKind& n : kTables)
        if (n.table == table) return n.kind;
    return RecordKind::none;
}

std::string_view tableOfKind(RecordKind kind) {
    for (const NamedKind& n : kTables)
        if (n.kind == kind) return n.table;
    return {};
}

std::string locationOf(RecordKind kind, const Dictionary& properties) {
    const Value& value = properties[kCXRemoteLocationProperty];
    if (kind == RecordKind::subscription) return value.string();
    bool subscribed = kind == RecordKind::subscribedPerson || kind == RecordKind::subscribedGroup ||
                      kind == RecordKind::allSubscribedGroup;
    if (!subscribed) return {};
    if (value.isString()) return value.string();
    std::optional<CXMultiValue> multi = CXMultiValue::fromValue(value);
    if (!multi) return {};
    for (const auto& e : multi->entries())
        if (e.label == kCXSubscribeLabel && e.value.isString()) return e.value.string();
    return multi->empty() ? std::string() : multi->valueAtIndex(0).string();
}

DerivedColumns deriveColumns(RecordKind kind, const Dictionary& properties) {
    DerivedColumns columns;
    columns.location = locationOf(kind, properties);
    if (isPerson(kind)) {
        columns.display = cxDisplayName(properties);
        columns.sort = foldCase(sortText(properties));
        columns.search = cxSearchText(properties);
    } else {
        columns.display =
            properties[kind == RecordKind::subscription ? kCXSubscriptionNameProperty : kCXGroupNameProperty].string();
        columns.sort = foldCase(columns.display);
        columns.search = cxFoldedForSearch(columns.display);
    }
    return columns;
}

std::string foldCase(std::string_view utf8) {
    std::string out;
    out.reserve(utf8.size());
    for (size_t i = 0; i < utf8.size();) {
        auto [length, c] = codePoint(utf8, i);
        if (length == 0)
            out += utf8[i++];
        else if (length == 1)
            out += (c >= 'A' && c <= 'Z') ? static_cast<char>(c + 32) : static_cast<char>(c), i++;
        else
            appendUTF8(out, static_cast<char32_t>(towlower_l(static_cast<wint_t>(c), utf8Locale()))), i += length;
    }
    return out;
}

std::string defaultGroupName(RecordKind kind) {
    return dgettext("CXStrings", isAllKind(kind) ? "All Contacts" : "untitled group");
}

} // namespace rolvane
