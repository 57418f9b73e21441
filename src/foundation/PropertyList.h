#pragma once

#include "foundation/BinaryValue.h"
#include "foundation/Value.h"

#include <string>
#include <string_view>

namespace rolvane {

struct PropertyListLimits {
    size_t maxBytes = 64u << 20;
    int maxDepth = 64;
};

// XML property lists.
// Writer: deterministic (equal values of equal types give equal bytes), UTF-8, tab indentation, keys in byte order.
// Reals are written in the shortest form that reads back as the same number, "nan", "+infinity" and "-infinity" by
// name; dates with whole seconds, rounded towards the past. Refused with kCXPropertyListException, naming the place:
// text that is not UTF-8 or has a character that XML 1.0 cannot carry, dates outside the years 1 to 9999, absent
// values, and containers nested deeper than the default limit (a container that holds itself among them).
// Reader: UTF-8, or UTF-16 with a byte order mark. It refuses a document type other than `plist` with an external
// identifier and no internal subset, every entity but the five predefined ones, duplicate keys, tags longer than 512
// bytes, nesting over the depth limit and text over the size limit. It never opens a file or a connection for what a
// document names.
class PropertyList {
public:
    static std::string toXML(const Value& value);
    // Throws kCXPropertyListException with line and reason. Any thread.
    static Value fromXML(std::string_view text, const PropertyListLimits& limits = {});
    // The same with the path in the reason; kCXFileException when the file cannot be read.
    static Value fromFile(const std::string& path, const PropertyListLimits& limits = {});
};

} // namespace rolvane
