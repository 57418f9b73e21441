#include "contacts/vcard/VCardLabels.h"

#include "contacts/records/Constants.h"
#include "contacts/vcard/VCardText.h"

#include <algorithm>
#include <array>

namespace rolvane {

namespace {

struct Mapping {
    std::string_view name; // content line, "" for any
    std::string_view label;
    std::string_view types[2]; // all of them must be there; the second may be ""
};

// In the order of preference when several fit.
constexpr std::array<Mapping, 17> kMappings{{
    {"TEL", kCXHomeFaxLabel, {"home", "fax"}},
    {"TEL", kCXWorkFaxLabel, {"work", "fax"}},
    {"TEL", kCXMobileLabel, {"cell", ""}},
    {"TEL", kCXMobileLabel, {"mobile", ""}},
    {"TEL", kCXPagerLabel, {"pager", ""}},
    {"TEL", kCXMainLabel, {"main-number", ""}},
    {"TEL", kCXMainLabel, {"main", ""}},
    {"", kCXHomeLabel, {"home", ""}},
    {"", kCXWorkLabel, {"work", ""}},
    {"", kCXOtherLabel, {"other", ""}},
    {"RELATED", "Spouse", {"spouse", ""}},
    {"RELATED", "Child", {"child", ""}},
    {"RELATED", "Parent", {"parent", ""}},
    {"RELATED", "Sibling", {"sibling", ""}},
    {"RELATED", "Friend", {"friend", ""}},
    {"RELATED", "Colleague", {"colleague", ""}},
    {"RELATED", "Emergency", {"emergency", ""}},
}};

bool has(const std::vector<std::string>& types, std::string_view type) {
    return std::find(types.begin(), types.end(), type) != types.end();
}

constexpr std::string_view kCommonStart = "_$!<", kCommonEnd = ">!$_";

// Labels that programs have in common, beside those that TYPE says.
constexpr std::array<std::string_view, 14> kCommonLabels{
    kCXAnniversaryLabel, kCXHomePageLabel, kCXOtherLabel, "Spouse",  "Partner",  "Child", "Parent", "Mother", "Father",
    "Brother",           "Sister",         "Friend",      "Manager", "Assistant"};

bool mereManner(std::string_view type) {
    for (auto t : {"pref", "voice", "internet", "msg", "text", "x400", "dom", "intl", "postal", "parcel"})
        if (type == t) return true;
    return type.empty();
}

} // namespace

std::string vcardLabelForTypes(std::string_view name, const std::vector<std::string>& types) {
    for (const auto& m : kMappings) {
        if (!m.name.empty() && m.name != name) continue;
        if (has(types, m.types[0]) && (m.types[1].empty() || has(types, m.types[1]))) return std::string(m.label);
    }
    for (const auto& t : types)
        if (!mereManner(t)) return vcardUpper(t.substr(0, 1)) + t.substr(1);
    return "";
}

std::string vcardLabelFromText(const std::string& text) {
    const bool common = text.size() > kCommonStart.size() + kCommonEnd.size() && text.starts_with(kCommonStart) &&
                        text.ends_with(kCommonEnd);
    if (!common) return text;
    std::string word = text.substr(kCommonStart.size(), text.size() - kCommonStart.size() - kCommonEnd.size());
    for (const auto& m : kMappings)
        if (vcardEqualNoCase(m.label, word)) return std::string(m.label);
    for (const auto label : kCommonLabels)
        if (vcardEqualNoCase(label, word)) return std::string(label);
    return word;
}

std::optional<std::string> vcardTextForLabel(const std::string& label) {
    if (vcardTrim(label).empty()) return std::nullopt;
    const bool common = std::find(kCommonLabels.begin(), kCommonLabels.end(), label) != kCommonLabels.end();
    std::string text = common ? std::string(kCommonStart) += label + std::string(kCommonEnd) : label;
    return vcardLabelFromText(text) == label ? std::optional(text) : std::nullopt;
}

std::vector<std::string> vcardTypesForLabel(std::string_view name, std::string_view label) {
    for (const auto& m : kMappings) {
        if ((!m.name.empty() && m.name != name) || m.label != label) continue;
        std::vector<std::string> types{std::string(m.types[0])};
        if (!m.types[1].empty())
            types.emplace_back(m.types[1]);
        else if (name == "TEL" && (label == kCXHomeLabel || label == kCXWorkLabel))
            types.emplace_back("voice");
        return types;
    }
    return {};
}

bool vcardTypesAddToLabel(std::string_view name, std::string_view label, const std::vector<std::string>& types) {
    auto expected = vcardTypesForLabel(name, label);
    for (const auto& t : types)
        if (!t.empty() && !has(expected, t)) return true;
    return false;
}

} // namespace rolvane
