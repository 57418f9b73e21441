#pragma once

#include "contacts/CXMultiValue.h"
#include "contacts/VCardReader.h"
#include "contacts/VCardWriter.h"
#include "foundation/PropertyList.h"

#include <cstdint>
#include <sstream>
#include <stdexcept>
#include <string>

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
                        read->members == entity->members && read->subgroups == entity->subgroups;
            if (same) continue;
            throw std::logic_error("a card that was written reads back as something else: " + reason + error.reason +
                                   "\n" + text);
        }
    }
}

} // namespace rolvane::fuzz
