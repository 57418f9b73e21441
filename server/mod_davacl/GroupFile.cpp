#include "server/mod_davacl/GroupFile.h"

#include <algorithm>
#include <functional>

namespace rolvane::davacl {
namespace {

constexpr std::string_view kBlank = " \t\r";

std::string_view trimmed(std::string_view text) {
    text.remove_prefix(std::min(text.find_first_not_of(kBlank), text.size()));
    return text.substr(0, text.find_last_not_of(kBlank) + 1);
}

void forEachGroup(std::string_view text, const std::function<void(std::string_view, std::string_view)>& call) {
    while (!text.empty()) {
        const size_t end = std::min(text.find('\n'), text.size());
        const std::string_view line = trimmed(text.substr(0, end));
        text.remove_prefix(std::min(end + 1, text.size()));
        const size_t colon = line.find(':');
        if (line.starts_with('#') || colon == std::string_view::npos) continue;
        if (const std::string_view name = trimmed(line.substr(0, colon)); !name.empty())
            call(name, line.substr(colon + 1));
    }
}

void forEachWord(std::string_view text, const std::function<void(std::string_view)>& call) {
    for (;;) {
        text.remove_prefix(std::min(text.find_first_not_of(kBlank), text.size()));
        if (text.empty()) return;
        const size_t end = std::min(text.find_first_of(kBlank), text.size());
        call(text.substr(0, end));
        text.remove_prefix(end);
    }
}

} // namespace

std::set<std::string> groupsOf(std::string_view user, std::string_view groupFile) {
    std::set<std::string> groups;
    forEachGroup(groupFile, [&](std::string_view name, std::string_view users) {
        forEachWord(users, [&](std::string_view word) {
            if (word == user) groups.emplace(name);
        });
    });
    return groups;
}

std::set<std::string> usersIn(std::string_view group, std::string_view groupFile) {
    std::set<std::string> users;
    forEachGroup(groupFile, [&](std::string_view name, std::string_view words) {
        if (name == group) forEachWord(words, [&](std::string_view word) { users.emplace(word); });
    });
    return users;
}

std::set<std::string> groupsIn(std::string_view groupFile) {
    std::set<std::string> groups;
    forEachGroup(groupFile, [&](std::string_view name, std::string_view) { groups.emplace(name); });
    return groups;
}

} // namespace rolvane::davacl
