#include "contacts/records/SearchText.h"

#include "contacts/records/CXMultiValue.h"
#include "contacts/records/Constants.h"
#include "contacts/records/RecordKind.h"

#include <algorithm>
#include <array>
#include <unordered_map>
#include <utility>

namespace rolvane {

namespace {

// Letters with the plain ones in their place; small letters only, as letter case is folded before.
struct Plain {
    const char* letters;
    const char* plain;
};
constexpr std::array<Plain, 37> kPlain{{
    {"àáâãäåāăąǎǟǡǻȁȃȧḁạảấầẩẫậắằẳẵặ", "a"},
    {"ḃḅḇ", "b"},
    {"çćĉċčḉ", "c"},
    {"ďđðḋḍḏḑḓ", "d"},
    {"èéêëēĕėęěȅȇȩḕḗḙḛḝẹẻẽếềểễệ", "e"},
    {"ḟ", "f"},
    {"ĝğġģǧǵḡ", "g"},
    {"ĥħȟḣḥḧḩḫẖ", "h"},
    {"ìíîïĩīĭįıǐȉȋḭḯỉị", "i"},
    {"ĵǰ", "j"},
    {"ķǩḱḳḵ", "k"},
    {"ĺļľŀłḷḹḻḽ", "l"},
    {"ḿṁṃ", "m"},
    {"ñńņňŉǹṅṇṉṋ", "n"},
    {"òóôõöøōŏőơǒǫǭǿȍȏȫȭȯȱṍṏṑṓọỏốồổỗộớờởỡợ", "o"},
    {"ṕṗ", "p"},
    {"ŕŗřȑȓṙṛṝṟ", "r"},
    {"śŝşšșṡṣṥṧṩſ", "s"},
    {"ţťŧțṫṭṯṱẗ", "t"},
    {"ùúûüũūŭůűųưǔǖǘǚǜȕȗṳṵṷṹṻụủứừửữự", "u"},
    {"ṽṿ", "v"},
    {"ŵẁẃẅẇẉẘ", "w"},
    {"ẋẍ", "x"},
    {"ýÿŷȳẏẙỳỵỷỹ", "y"},
    {"źżžẑẓẕ", "z"},
    {"æǣǽ", "ae"},
    {"œ", "oe"},
    {"ß", "ss"},
    {"þ", "th"},
    {"ά", "α"},
    {"έ", "ε"},
    {"ή", "η"},
    {"ίϊΐ", "ι"},
    {"ό", "ο"},
    {"ύϋΰ", "υ"},
    {"ώ", "ω"},
    {"ё", "е"},
}};

size_t lengthAt(std::string_view s, size_t i) {
    const auto first = static_cast<unsigned char>(s[i]);
    const size_t length = first < 0xC0 ? 1 : first < 0xE0 ? 2 : first < 0xF0 ? 3 : 4;
    return std::min(length, s.size() - i);
}

const std::unordered_map<std::string_view, std::string_view>& plainLetters() {
    static const auto all = [] {
        std::unordered_map<std::string_view, std::string_view> map;
        for (const Plain& line : kPlain) {
            const std::string_view letters = line.letters;
            for (size_t i = 0; i < letters.size(); i += lengthAt(letters, i))
                map.emplace(letters.substr(i, lengthAt(letters, i)), line.plain);
        }
        return map;
    }();
    return all;
}

bool isCombining(std::string_view letter) { // U+0300 to U+036F: the accents themselves
    if (letter.size() != 2) return false;
    const auto first = static_cast<unsigned char>(letter[0]), second = static_cast<unsigned char>(letter[1]);
    return first == 0xCC || (first == 0xCD && second < 0xB0);
}

bool isDigit(char c) {
    return c >= '0' && c <= '9';
}

// The zero of "+49 (0)170" is dialled within the country only.
std::string digitsOf(std::string_view text) {
    constexpr std::string_view withinCountry = "(0)";
    std::string digits;
    for (size_t i = 0; i < text.size(); ++i)
        if (text.substr(i).starts_with(withinCountry))
            i += withinCountry.size() - 1;
        else if (isDigit(text[i]))
            digits += text[i];
    return digits;
}

// What is dialled within a country: without the zeros before it.
std::string_view withoutZeros(std::string_view digits) {
    const size_t from = digits.find_first_not_of('0');
    return from == std::string_view::npos ? std::string_view() : digits.substr(from);
}

void append(std::string& text, std::string_view more) {
    if (more.empty()) return;
    if (!text.empty()) text += ' ';
    text += more;
}

bool isNumber(std::string_view word) {
    return std::any_of(word.begin(), word.end(), isDigit) &&
           word.find_first_not_of("0123456789+-./()") == std::string_view::npos;
}

constexpr size_t kWholeNumber = 7; // digits of a number that is one without its area's

// The whole numbers of a text are its runs of digits.
template <class Call>
bool anyRunOfDigits(std::string_view text, const Call& call) {
    for (size_t i = 0; i < text.size();) {
        if (!isDigit(text[i])) {
            ++i;
            continue;
        }
        size_t end = i;
        while (end < text.size() && isDigit(text[end])) ++end;
        if (call(text.substr(i, end - i))) return true;
        i = end;
    }
    return false;
}

bool hasNumber(std::string_view text, const std::string& number) {
    if (number.empty()) return false;
    if (text.find(number) != std::string_view::npos) return true;
    const std::string_view own = withoutZeros(number);
    if (own.size() < kWholeNumber) return false;
    // The last digits are in every number that can be meant, so that most texts need no second look.
    if (text.find(own.substr(own.size() - kWholeNumber)) == std::string_view::npos) return false;
    return anyRunOfDigits(text, [&](std::string_view run) {
        const std::string_view theirs = withoutZeros(run);
        return theirs.size() >= kWholeNumber && (theirs.ends_with(own) || own.ends_with(theirs));
    });
}

bool hasAll(std::string_view text, const std::vector<std::string>& words) {
    return std::all_of(words.begin(), words.end(),
                       [&](const std::string& word) { return text.find(word) != std::string_view::npos; });
}

} // namespace

std::string cxFoldedForSearch(std::string_view utf8) {
    std::string out;
    const std::string small = foldCase(utf8);
    out.reserve(small.size());
    const auto& plain = plainLetters();
    for (size_t i = 0; i < small.size();) {
        if (static_cast<unsigned char>(small[i]) < 0x80) {
            out += small[i++];
            continue;
        }
        const std::string_view letter = std::string_view(small).substr(i, lengthAt(small, i));
        i += letter.size();
        if (isCombining(letter)) continue;
        const auto found = plain.find(letter);
        out += found == plain.end() ? letter : found->second;
    }
    return out;
}

std::string cxSearchText(const Dictionary& person) {
    std::string text;
    for (const char* key : {kCXFirstNameProperty, kCXMiddleNameProperty, kCXLastNameProperty, kCXNicknameProperty,
                            kCXMaidenNameProperty, kCXFormattedNameProperty, kCXOrganizationProperty,
                            kCXDepartmentProperty, kCXFirstNamePhoneticProperty, kCXLastNamePhoneticProperty})
        append(text, person[key].string());
    const auto each = [&](const char* property, const auto& call) {
        if (const auto values = CXMultiValue::fromValue(person[property]))
            for (const auto& entry : values->entries()) call(entry.value.string());
    };
    each(kCXEmailProperty, [&](const std::string& mail) { append(text, mail); });
    each(kCXPhoneProperty, [&](const std::string& phone) { append(text, phone); });
    each(kCXPhoneProperty, [&](const std::string& phone) { append(text, digitsOf(phone)); });
    append(text, person[kCXNoteProperty].string());
    return cxFoldedForSearch(text);
}

CXSearchQuery::CXSearchQuery(std::string_view words) {
    const std::string folded = cxFoldedForSearch(words);
    bool behindNumber = false;
    for (size_t i = 0; i < folded.size();) {
        const size_t begin = folded.find_first_not_of(" \t\n\r", i);
        if (begin == std::string::npos) break;
        const size_t end = std::min(folded.find_first_of(" \t\n\r", begin), folded.size());
        const std::string word = folded.substr(begin, end - begin);
        i = end;
        if (!isNumber(word)) {
            _texts.push_back(word);
            behindNumber = false;
            continue;
        }
        if (!std::exchange(behindNumber, true)) _numbers.emplace_back();
        _numbers.back().digits += digitsOf(word);
        _numbers.back().words.push_back(word);
    }
}

bool CXSearchQuery::fits(std::string_view searchText) const {
    return !empty() && hasAll(searchText, _texts) &&
           std::all_of(_numbers.begin(), _numbers.end(), [&](const Number& number) {
               return hasNumber(searchText, number.digits) || hasAll(searchText, number.words);
           });
}

} // namespace rolvane
