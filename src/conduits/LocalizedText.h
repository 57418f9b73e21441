#pragma once

#include <string>

namespace rolvane {

// The person's language for a key of the text domain "CXStrings"; without a catalogue the built-in English text, and
// the key itself when there is none.
std::string localizedText(const char* key);

} // namespace rolvane
