#include "server/mod_cardbook/PartialCard.h"

#include "contacts/vcard/VCardText.h"

#include <algorithm>

namespace rolvane::cardbook {
namespace {

// The property's name and where its value begins, which parameters in quotes may stand before.
std::pair<std::string, size_t> nameAndValueOf(std::string_view line) {
    std::string_view name = line.substr(0, line.find_first_of(":;"));
    if (const size_t dot = name.rfind('.'); dot != std::string_view::npos) name.remove_prefix(dot + 1);
    bool quoted = false;
    size_t colon = 0;
    for (; colon < line.size() && (quoted || line[colon] != ':'); ++colon)
        if (line[colon] == '"') quoted = !quoted;
    return {vcardUpper(name), std::min(colon + 1, line.size())};
}

} // namespace

std::string partialCard(const std::string& card, const std::vector<AddressData::Line>& lines) {
    std::string out;
    for (size_t at = 0; at < card.size();) {
        size_t end = at; // of the line with those that go on with it
        do end = std::min(card.find('\n', end), card.size() - 1) + 1;
        while (end < card.size() && (card[end] == ' ' || card[end] == '\t'));
        const std::string_view line = std::string_view(card).substr(at, end - at);
        const auto [name, value] = nameAndValueOf(line);
        const bool isFrame = name == "BEGIN" || name == "END" || name == "VERSION";
        const auto wanted = std::find_if(lines.begin(), lines.end(),
                                         [&, &called = name](const AddressData::Line& l) { return l.name == called; });
        if (isFrame)
            out += line;
        else if (wanted != lines.end())
            out += wanted->withoutValue ? std::string(line.substr(0, value)) + "\r\n" : std::string(line);
        at = end;
    }
    return out;
}

} // namespace rolvane::cardbook
