#include "contacts/VCardLabels.h"

#include "contacts/Constants.h"
#include "contacts/VCardText.h"

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

bool goesWithoutSaying(std::string_view name, std::string_view type) {
    return type.empty() || (name == "TEL" && type == "voice") || (name == "EMAIL" && type == "internet");
}

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
        if (!goesWithoutSaying(name, t) && !has(expected, t)) return true;
    return false;
}

} // namespace rolvane
