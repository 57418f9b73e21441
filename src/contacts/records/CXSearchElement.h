#pragma once

#include "contacts/records/Constants.h"
#include "foundation/Value.h"

#include <string>
#include <string_view>

namespace rolvane {

// What to look for in one table: records whose property compares so with the value. With a label, only multi-value
// entries of that label count; with a key, that key of dictionary values. A missing property matches nothing but
// kCXNotEqual. The all-contacts groups match no element: they are found by their location.
struct CXSearchElement {
    std::string table;
    std::string property;
    std::string label; // "" none
    std::string key;   // "" none
    Value value;
    CXSearchComparison comparison = kCXEqual;

    // Pure: does this value of the property match?
    bool matches(const Value& propertyValue) const;
};

} // namespace rolvane
