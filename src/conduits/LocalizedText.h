#pragma once

#include <initializer_list>
#include <string>
#include <string_view>
#include <utility>

namespace rolvane {

// Where the catalogs of the text domain "CXStrings" lie: LANGUAGE/LC_MESSAGES/CXStrings.mo. At start.
void useCatalogsIn(const std::string& directory);

// The person's language for a key of the text domain "CXStrings"; without a catalogue the built-in English text, and
// the key itself when there is none. The process keeps its own language, so that its log stays as it is. Any thread.
std::string localizedText(const char* key);
// The same with every "{name}" replaced by its value.
std::string localizedText(const char* key, std::initializer_list<std::pair<std::string_view, std::string>> values);

} // namespace rolvane
