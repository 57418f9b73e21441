#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

struct VCardParameter {
    std::string name; // in capitals
    std::vector<std::string> values;

    friend bool operator==(const VCardParameter&, const VCardParameter&) = default;
};

// One unfolded content line (RFC 2426 section 4, RFC 6350 section 3.3):
//     [group "."] name *(";" parameter) ":" value
// Everything is kept, known or not: a line that is parsed and written again says the same. Plain value, any thread.
struct VCardLine {
    std::string group; // as written, "" for none
    std::string name;  // in capitals
    std::vector<VCardParameter> parameters;
    std::string value; // escapes still in place, transfer encoding still applied
    size_t number = 0; // of the physical line it began on, from 1

    const VCardParameter* parameter(std::string_view parameterName) const; // the first of that name, null for none
    std::string firstValueOf(std::string_view parameterName) const;        // "" for none
    bool hasType(std::string_view type) const; // a value of any TYPE parameter, without case
    std::vector<std::string> types() const;    // of all TYPE parameters, in small letters
    // Of a named character set or in a transfer encoding of mail, which scanning resolves.
    bool isStillEncoded() const;
    void add(std::string_view parameterName,
             std::string parameterValue); // to the parameter of that name, made if absent

    // Equal whatever line of a file they stood on.
    friend bool operator==(const VCardLine& a, const VCardLine& b) {
        return a.group == b.group && a.name == b.name && a.parameters == b.parameters && a.value == b.value;
    }
};

// The line in an unfolded text. vCard 2.1 is understood: a parameter that is only a word is a TYPE or an ENCODING.
// RFC 6868 escapes in parameter values are resolved unless the card is of version 2.1. Nothing when the text is no
// content line; `reason`, when given, then says why.
std::optional<VCardLine> vcardParseLine(std::string_view text, bool version21 = false, std::string* reason = nullptr);

// What can be made of a text that is no content line because of its parameters: those that cannot be read are passed
// over, but for the label in the brackets of "X-CUSTOM(CHARSET=UTF-8,ENCODING=QUOTED-PRINTABLE,=4D)", which becomes a
// TYPE. Nothing when there is no name or no value.
std::optional<VCardLine> vcardParseDamagedLine(std::string_view text);

// The line as text without folding and line end. Parameter values are quoted where they must be, and characters that
// no quoting can carry go as RFC 6868 escapes.
std::string vcardFormatLine(const VCardLine& line);

// Appends the text folded at 75 octets (without the line end) and ended by CRLF. No UTF-8 sequence is cut.
void vcardAppendFolded(std::string& out, std::string_view unfolded);

// Escapes of text values: backslash, comma, semicolon, line feed (RFC 6350 section 3.4). A CR LF or lone CR counts as
// a line feed. `vcardUnescape` leaves a backslash before any other character in place, but for "\:".
std::string vcardEscape(std::string_view text);
std::string vcardUnescape(std::string_view text);

// The parts of a structured or listed value, still escaped: split at every separator that no backslash precedes.
std::vector<std::string_view> vcardSplit(std::string_view value, char separator);

} // namespace rolvane
