#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

// Labels of multi-value entries and the TYPE values that say the same in a vCard. Pure functions.

// The label that the types (in small letters) mean for the content-line name ("TEL", "EMAIL", "ADR", "URL", "IMPP",
// "RELATED"): one of the known labels, else the first type that is no mere manner of transport, with a capital
// ("Car"); "" when the types say nothing.
std::string vcardLabelForTypes(std::string_view name, const std::vector<std::string>& types);

// The label that the text of an X-ABLabel means: the words that programs have in common stand in it as
// "_$!<HomeFAX>!$_", everything else as it is.
std::string vcardLabelFromText(const std::string& text);

// The text to write for a label in an X-ABLabel; nothing when reading it would give another label.
std::optional<std::string> vcardTextForLabel(const std::string& label);

// The types to write for a label; empty for a label that no types express. `vcardLabelForTypes` of them is the label.
std::vector<std::string> vcardTypesForLabel(std::string_view name, std::string_view label);

// Types that say something about a value besides its label: not those of `vcardTypesForLabel`.
bool vcardTypesAddToLabel(std::string_view name, std::string_view label, const std::vector<std::string>& types);

} // namespace rolvane
