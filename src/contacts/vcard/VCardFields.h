#pragma once

#include "contacts/vcard/VCardLine.h"
#include "foundation/Date.h"
#include "foundation/Value.h"

#include <optional>
#include <string>
#include <string_view>

namespace rolvane {

// Values of vCard properties against values of person dictionaries, in both directions. Pure functions; "raw" is the
// text of a content line behind its colon, escapes in place.

// Which multi-value property of a person a content line feeds, and how. All of these are written as they are read.
struct VCardMultiField {
    const char* lineName; // "TEL"
    const char* property; // kCXPhoneProperty
    bool inVersion3;      // a property of vCard 3.0; else it goes there as X-ROLVANE-<lineName>
    bool inVersion4;      // the same of 4.0
    const char* xSuffix;  // labelled extension properties X-...<suffix> are read as this one, "" for none
};
const VCardMultiField* vcardMultiFieldForLine(std::string_view lineName, bool labelled);
const VCardMultiField* vcardMultiFieldForProperty(std::string_view property);

// Extension properties that name the custom label of the other properties of their group: X-...LABEL.
bool vcardIsLabelLine(const VCardLine& line);

// One value of a multi-value property. Decoding gives an absent value when there is nothing in it or it is not of the
// kind that the property holds (then the line is kept as it is); encoding nothing when the value has no such form.
Value vcardDecodeMultiValue(std::string_view property, const VCardLine& line);
std::optional<std::string> vcardEncodeMultiValue(std::string_view property, const Value& value);

// A URI goes as it is: only a backslash and a line feed, which it should not have, are escaped.
std::string vcardEncodeURI(std::string_view text);

// Text that a content line can carry and give back unchanged.
bool vcardIsPlainText(std::string_view text);

// N: the five parts into and out of the person's dictionary. Lists inside a part are joined.
void vcardDecodeName(const VCardLine& line, Dictionary& person);
std::string vcardEncodeName(const Dictionary& person);
// The raw value of an N whose parts are lists, of which the dictionary has only the joined text; "" for any other line.
std::string vcardListedName(const VCardLine& line);
// The parts of an ADR or N behind those that have a place in the dictionary (RFC 9554 knows some), raw; "" for none.
std::string vcardSurplusParts(const VCardLine& line);
// ORG: organisation and its units; several units are one department, separated by "; ".
void vcardDecodeOrganization(const VCardLine& line, Dictionary& person);
std::string vcardEncodeOrganization(const Dictionary& person);
// NICKNAME and CATEGORIES are lists; several nicknames are one text, separated by ", ".
std::vector<std::string> vcardDecodeList(const VCardLine& line);
std::string vcardEncodeList(const std::vector<std::string>& items);
void vcardDecodeNickname(const VCardLine& line, Dictionary& person);
std::string vcardEncodeNickname(const Dictionary& person);

// Properties that stand as one text in a line of their own: NOTE, TITLE and the like. Some have several names; the
// second function gives the one that is written. Null for none.
const char* vcardTextPropertyForLine(std::string_view lineName);
const char* vcardLineForTextProperty(std::string_view property);

// The raw value of a line of which a card has one (KIND, FN, N, NICKNAME, ORG, BDAY, PHOTO and those of
// vcardTextPropertyForLine, by the names that are written), "" when the properties have none. A BDAY is in the form of
// vCard 4.0; for a PHOTO it is a digest of the bytes.
std::string vcardEncodeSingle(std::string_view lineName, const Dictionary& properties, bool isGroup);

// Properties that no card may set by an exact value: with whom something is shared, and what is written by rules of its
// own.
bool vcardIsNeverExact(std::string_view property);

// A full date, with or without time in UTC, in the basic or the extended form ("19850412", "1985-04-12T10:00:00Z").
// Anything else, the truncated forms of vCard 4.0 among it, is nothing.
std::optional<Date> vcardDecodeDate(std::string_view text);
std::string vcardEncodeDate(Date date, bool version4);
// A birthday whose year is a mere filling is a full date with a parameter that names the year: "X-…-OMIT-YEAR=1604".
// That year, 0 for none.
int vcardOmittedYear(const VCardLine& line);
// A truncated date of vCard 4.0 ("--0412", "1985-04", "---12"), which needs no VALUE=text.
bool vcardIsTruncatedDate(std::string_view text);
// The day of a year in the forms "--0412" and "--04-12", as "--0412"; "" for any other text.
std::string vcardDayOfYear(std::string_view text);

struct VCardPhoto {
    Bytes bytes;
    std::string mediaType; // "image/png", "" when unknown
};
// Inline photos of all versions. Nothing with an empty `reason`: it is a reference to elsewhere. Nothing with a
// reason: the photo is damaged.
std::optional<VCardPhoto> vcardDecodePhoto(const VCardLine& line, std::string& reason);
VCardLine vcardEncodePhoto(const VCardPhoto& photo, bool version4);

// A media type by the first bytes of an image, "" when they are not known.
std::string vcardSniffMediaType(const Bytes& bytes);

// What FN says of a person without a formatted name of its own: the parts of the name, else the organisation,
// nickname, first mail address, first telephone number, else "".
std::string vcardDerivedFormattedName(const Dictionary& person);

// The UUID that stands for the text of a UID: itself when it is one (bare or as urn:uuid:), else the name-based UUID
// (RFC 4122 section 4.3, SHA-1) of the text, so that the same UID always gives the same record.
std::string vcardUUIDForUID(std::string_view uid);
bool vcardIsUUID(std::string_view text);

} // namespace rolvane
