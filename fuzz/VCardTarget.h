#pragma once

#include "contacts/records/CXMultiValue.h"
#include "contacts/vcard/VCardReader.h"
#include "contacts/vcard/VCardWriter.h"
#include "foundation/PropertyList.h"

#include <algorithm>
#include <cstdint>
#include <sstream>
#include <stdexcept>
#include <string>
#include <vector>

namespace rolvane::fuzz {

// Equal but for the identifiers of multi-value entries, which every reading makes afresh.
inline bool sameProperties(const Dictionary& a, const Dictionary& b) {
    if (a.count() != b.count()) return false;
    for (const auto& [key, value] : a) {
        auto ma = CXMultiValue::fromValue(value), mb = CXMultiValue::fromValue(b[key]);
        if (ma && mb ? !ma->sameContents(*mb) : BinaryValue::encode(value) != BinaryValue::encode(b[key])) return false;
    }
    return true;
}

// Somebody belongs to a category or does not.
inline std::vector<std::string> withoutRepeats(const std::vector<std::string>& names) {
    std::vector<std::string> once;
    for (const auto& n : names)
        if (std::find(once.begin(), once.end(), n) == once.end()) once.push_back(n);
    return once;
}

inline std::string summary(const VCardEntity& e) {
    std::string out = (e.isGroup ? "group " : "person ") + e.uid + "\n" + description(e.properties);
    for (const auto& c : e.categories) out += "\ncategory " + c;
    for (const auto& m : e.members) out += "\nmember " + m;
    for (const auto& g : e.subgroups) out += "\nsubgroup " + g;
    for (const auto& c : e.choices) out += "\nchoice " + c.member + " " + c.property + " " + c.label + " " + c.raw;
    return out;
}

// Whatever the bytes are, reading them ends, and every good card is written in both versions so that it reads as the
// same again. Throws std::logic_error when that does not hold.
inline void checkVCard(const uint8_t* data, size_t size) {
    std::istringstream in(std::string(reinterpret_cast<const char*>(data), size));
    VCardScanner scanner(in, "input", [](const VCardError&) {});
    while (auto card = scanner.next()) {
        VCardError error;
        auto entity = vcardEntityFromCard(*card, error);
        if (!entity) continue;
        for (auto version : {VCardVersion::v3, VCardVersion::v4}) {
            std::string text = vcardText(*entity, version);
            std::istringstream again(text);
            std::string reason;
            VCardScanner second(again, "written", [&](const VCardError& e) { reason = e.description(); });
            auto back = second.next();
            auto read = back ? vcardEntityFromCard(*back, error) : std::nullopt;
            bool same = read && sameProperties(read->properties, entity->properties) &&
                        read->isGroup == entity->isGroup && read->uid == entity->uid &&
                        read->categories == withoutRepeats(entity->categories) && read->members == entity->members &&
                        read->subgroups == entity->subgroups && read->choices == entity->choices;
            if (same) continue;
            throw std::logic_error("a card that was written reads back as something else: " + reason + error.reason +
                                   "\n" + text + "read first as:\n" + summary(*entity) + "\nread again as:\n" +
                                   (read ? summary(*read) : "nothing"));
        }
    }
}

} // namespace rolvane::fuzz
