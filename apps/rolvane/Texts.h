#pragma once

#include "foundation/Date.h"

#include <fmt/format.h>
#include <string>
#include <string_view>

namespace rolvane::cli {

// The person's language. A text is looked up by its English words in the catalogs of the text domain "rolvane" (po/).
// Until `useLanguageOfThePerson` was called, and with LANG=C, texts are English and dates those of the formats for
// programs: so documents of --json, manual pages and completions are the same everywhere.
void useLanguageOfThePerson();

// The text in that language; itself where the catalog has none. The pointer lives as long as the process.
const char* translated(const char* text);

// Marks a text for the catalogs that is looked up elsewhere.
constexpr const char* marked(const char* text) {
    return text;
}

// fmt::format with the text in that language. A translation may name its places ("{1} of {0}").
template <class... Arguments>
std::string tr(fmt::format_string<Arguments...> text, Arguments&&... arguments) {
    const fmt::string_view words = text;
    return fmt::vformat(translated(words.data()), fmt::make_format_args(arguments...));
}

// "1 person", "2 people", "12.345 Personen".
std::string countedText(unsigned long long count, const char* one, const char* more);
// With the separators of that language.
std::string shownNumber(unsigned long long number);

// A moment for a person: local time, as the language writes it.
std::string shownDate(const Date& date);
// The same of a text as programs get it ("2026-11-21T01:44:09Z"); what is no such text stays.
std::string shownDate(const std::string& text);

// A day ("1980-12-31") as the language writes it; no time zone moves it.
std::string shownDay(const std::string& day);

} // namespace rolvane::cli
