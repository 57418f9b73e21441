#include "server/mod_cardbook/ClientCard.h"

#include "contacts/records/CXPerson.h"
#include "contacts/vcard/VCardFields.h"
#include "foundation/Utf8.h"
#include "server/mod_cardbook/Refused.h"

#include <algorithm>
#include <sstream>

namespace rolvane::cardbook {
namespace {

[[noreturn]] void invalid(const std::string& words) {
    throw Refused(403, kCardSpace, "valid-address-data", words);
}

VCardEntity entityOf(const VCard& card) {
    VCardError error;
    auto entity = vcardEntityFromCard(card, error);
    if (!entity) invalid("Line " + std::to_string(error.line) + ": " + error.reason);
    return std::move(*entity);
}

// More than any program writes. What comes behind compares lines and values with each other. Members are looked up.
constexpr size_t kMostLines = 1000, kMostOfALine = 1000;

void refuseTooMany(const VCard& card) {
    size_t lines = 0;
    for (const VCardLine& line : card.lines) {
        if (line.name == "MEMBER" || line.name == "X-ADDRESSBOOKSERVER-MEMBER") continue;
        if (++lines > kMostLines) invalid("The card has more than " + std::to_string(kMostLines) + " lines.");
        size_t values = line.name == "CATEGORIES" || line.name == "NICKNAME"
                            ? static_cast<size_t>(std::count(line.value.begin(), line.value.end(), ','))
                            : 0;
        for (const VCardParameter& parameter : line.parameters) values += 1 + parameter.values.size();
        if (values > kMostOfALine) invalid("The line " + line.name + " has too many values.");
    }
}

// The part of a UID that is kept, since its record's identifier does not say it in the same letters.
void keepUID(VCardEntity& entity) {
    if (entity.uid == vcardUIDForUUID(vcardUUIDForUID(entity.uid))) return;
    VCardLine line;
    line.name = "UID";
    line.value = vcardEscape(entity.uid);
    vcardReplaceKeptLines(entity.properties, "UID", {line});
}

} // namespace

ClientCard readClientCard(const std::string& text, Bounds bounds) {
    if (!isUtf8(text)) invalid("The card is not UTF-8.");
    std::istringstream in(text);
    std::string why;
    VCardScanner scanner(in, "card", [&](const VCardError& error) {
        if (why.empty()) why = "Line " + std::to_string(error.line) + ": " + error.reason;
    });
    const auto card = scanner.next();
    if (!card) invalid(why.empty() ? "This is no vCard." : why);
    if (scanner.next()) invalid("There are two cards where one belongs.");
    if (!why.empty()) invalid(why);
    if (card->version != "3.0" && card->version != "4.0")
        throw Refused(403, kCardSpace, "supported-address-data", "Cards are text/vcard of version 3.0 or 4.0.");

    if (bounds == Bounds::ofClients) refuseTooMany(*card);
    ClientCard read;
    read.text = text;
    read.isVersion4 = card->version == "4.0";
    for (const VCardLine& line : card->lines) read.lineNames.insert(line.name);
    read.entity = entityOf(*card);
    read.isWhole = read.entity.notices.empty();
    if (read.entity.uid.empty()) invalid("The card has no UID.");
    if (!read.entity.isGroup && !read.entity.categories.empty()) {
        Array names;
        for (const std::string& name : read.entity.categories)
            if (!names.containsString(name)) names.append(name);
        read.entity.properties.set(kCXCategoriesProperty, names);
        read.entity.categories.clear();
    }
    for (const char* own : {kVCardCategoryOrderLine, kVCardMissingMemberLine, kVCardJoinedUIDLine})
        vcardReplaceKeptLines(read.entity.properties, own, {});
    keepUID(read.entity);
    return read;
}

} // namespace rolvane::cardbook
