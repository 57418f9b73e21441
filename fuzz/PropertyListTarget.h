#pragma once

#include "foundation/PropertyList.h"

#include <stdexcept>

namespace rolvane::fuzz {

// Any text is read or refused with the reader's own exception; what was read is written, and its text stands still:
// reading and writing it once more gives the same bytes. Throws std::logic_error when that does not hold.
inline void checkPropertyList(const uint8_t* data, size_t size) {
    Value value;
    try {
        value = PropertyList::fromXML({reinterpret_cast<const char*>(data), size});
    } catch (const CXException& e) {
        if (e.name() != kCXPropertyListException) throw std::logic_error("refused as " + e.name());
        return;
    }
    const std::string text = PropertyList::toXML(value);
    if (PropertyList::toXML(PropertyList::fromXML(text)) != text)
        throw std::logic_error("a text that was written reads back as something else");
}

} // namespace rolvane::fuzz
