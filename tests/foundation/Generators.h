#pragma once

#include "foundation/Value.h"

#include <rapidcheck.h>

// Random values for round trips.
namespace rolvane::test {

// Text of every length of UTF-8 sequence, markup, line ends and blanks; nothing that XML cannot carry.
rc::Gen<std::string> xmlText();
// Any bytes.
rc::Gen<std::string> anyText();
// Values up to a few levels deep; whole-second dates, text that XML can carry, no absent values, no NaN.
rc::Gen<Value> plistValue();
// The same with any bytes in strings and keys, any date and absent values in arrays.
rc::Gen<Value> anyValue();

} // namespace rolvane::test
