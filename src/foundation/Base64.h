#pragma once

#include "foundation/Value.h"

#include <string>
#include <string_view>

namespace rolvane {

// RFC 4648, section 4, with padding.
void appendBase64(const uint8_t* data, size_t size, std::string& out);
// Skips white space; padding may be missing at the end. Nothing when any other character is there, when the length
// cannot be that of an encoding, or when something follows the padding.
std::optional<Bytes> fromBase64(std::string_view text);

} // namespace rolvane
