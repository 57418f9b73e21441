#include "server/mod_davacl/AccessLists.h"

#include "server/mod_davacl/Privileges.h"
#include "server/mod_davacl/TreePath.h"

#include <algorithm>

namespace rolvane::davacl {
namespace {

constexpr std::string_view kFirstLine = "davacl 1";
constexpr std::string_view kLastLine = "end";

bool isPlain(char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
           std::string_view("-._~@+").find(c) != std::string_view::npos;
}

int hexValue(char c) {
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    return -1;
}

// The text up to the separator, which must be there.
std::optional<std::string_view> take(std::string_view& rest, char separator) {
    const size_t end = rest.find(separator);
    if (end == std::string_view::npos) return std::nullopt;
    const std::string_view part = rest.substr(0, end);
    rest.remove_prefix(end + 1);
    return part;
}

std::optional<Principal> parsePrincipal(std::string_view text) {
    if (text == "authenticated") return Principal{Principal::Kind::authenticated, {}};
    const auto kind = take(text, ' ');
    if (!kind || (*kind != "user" && *kind != "group")) return std::nullopt;
    auto name = percentDecoded(text);
    if (!name || !isUsableName(*name)) return std::nullopt;
    return Principal{*kind == "user" ? Principal::Kind::user : Principal::Kind::group, std::move(*name)};
}

std::string principalText(const Principal& principal) {
    if (principal.kind == Principal::Kind::authenticated) return "authenticated";
    return (principal.kind == Principal::Kind::user ? "user " : "group ") + percentEncoded(principal.name, false);
}

bool concerns(const Principal& principal, const Caller& caller) {
    switch (principal.kind) {
    case Principal::Kind::authenticated: return true;
    case Principal::Kind::user: return principal.name == caller.name;
    case Principal::Kind::group: return caller.groups.contains(principal.name);
    }
    return false;
}

bool isWithin(const std::string& path, const std::string& tree) {
    return tree.empty() || path == tree || path.starts_with(tree + "/");
}

} // namespace

std::string percentEncoded(std::string_view text, bool keepSlashes) {
    static constexpr char digits[] = "0123456789ABCDEF";
    std::string out;
    for (const char c : text) {
        if (isPlain(c) || (keepSlashes && c == '/')) {
            out += c;
            continue;
        }
        const auto byte = static_cast<unsigned char>(c);
        out += {'%', digits[byte >> 4], digits[byte & 15]};
    }
    return out;
}

std::optional<std::string> percentDecoded(std::string_view text) {
    std::string out;
    for (size_t i = 0; i < text.size(); ++i) {
        if (isPlain(text[i]) || text[i] == '/') {
            out += text[i];
            continue;
        }
        if (text[i] != '%' || i + 2 >= text.size()) return std::nullopt;
        const int high = hexValue(text[i + 1]), low = hexValue(text[i + 2]);
        if (high < 0 || low < 0) return std::nullopt;
        out += static_cast<char>(high * 16 + low);
        i += 2;
    }
    return out;
}

void addGrant(AccessList& list, const Grant& grant) {
    if (!grant.read && !grant.write) return;
    for (Grant& known : list) {
        if (known.principal != grant.principal) continue;
        known.read = known.read || grant.read;
        known.write = known.write || grant.write;
        return;
    }
    list.push_back(grant);
}

std::optional<OwnersLists> OwnersLists::parse(std::string_view text) {
    OwnersLists lists;
    std::map<std::pair<std::string, Principal>, size_t> places; // of the entry in the list of the tree
    if (take(text, '\n') != kFirstLine) return std::nullopt;
    for (;;) {
        auto line = take(text, '\n');
        if (!line) return std::nullopt;
        if (*line == kLastLine) break;
        const auto path = take(*line, ' ');
        const auto rights = path ? take(*line, ' ') : std::nullopt;
        if (!rights || !path->starts_with('/')) return std::nullopt;
        const auto tree = percentDecoded(path->substr(1));
        const auto principal = parsePrincipal(*line);
        const Grant grant{principal.value_or(Principal()), *rights == "r" || *rights == "rw",
                          *rights == "w" || *rights == "rw"};
        if (!tree || !principal || (!grant.read && !grant.write)) return std::nullopt;
        AccessList& list = lists._lists[*tree];
        const auto [known, isNew] = places.try_emplace({*tree, *principal}, list.size());
        if (isNew) {
            list.push_back(grant);
            continue;
        }
        list[known->second].read |= grant.read;
        list[known->second].write |= grant.write;
    }
    if (!text.empty()) return std::nullopt;
    return lists;
}

std::string OwnersLists::text() const {
    std::string out = std::string(kFirstLine) + "\n";
    for (const auto& [tree, list] : _lists)
        for (const Grant& grant : list)
            out += "/" + percentEncoded(tree, true) + " " + (grant.read ? "r" : "") + (grant.write ? "w" : "") + " " +
                   principalText(grant.principal) + "\n";
    return out + std::string(kLastLine) + "\n";
}

const AccessList& OwnersLists::at(const std::string& tree) const {
    static const AccessList none;
    const auto found = _lists.find(tree);
    return found == _lists.end() ? none : found->second;
}

void OwnersLists::set(const std::string& tree, AccessList list) {
    if (list.empty())
        _lists.erase(tree);
    else
        _lists[tree] = std::move(list);
}

bool OwnersLists::drop(const std::string& tree) {
    return std::erase_if(_lists, [&](const auto& entry) { return isWithin(entry.first, tree); }) != 0;
}

bool OwnersLists::has(const std::string& tree) const {
    return std::any_of(_lists.begin(), _lists.end(), [&](const auto& entry) { return isWithin(entry.first, tree); });
}

void OwnersLists::move(const std::string& from, const std::string& to) {
    std::map<std::string, AccessList> moved;
    for (const auto& [tree, list] : _lists)
        if (isWithin(tree, from)) moved[to + tree.substr(from.size())] = list;
    drop(from);
    drop(to);
    _lists.merge(moved);
}

bool OwnersLists::mentionsGroups() const {
    for (const auto& [tree, list] : _lists)
        for (const Grant& grant : list)
            if (grant.principal.kind == Principal::Kind::group) return true;
    return false;
}

OwnersLists::Granted OwnersLists::grantedTo(const Caller& caller) const {
    Granted granted;
    if (caller.name.empty()) return granted;
    for (const auto& [tree, list] : _lists) {
        unsigned privileges = 0;
        for (const Grant& grant : list)
            if (concerns(grant.principal, caller))
                privileges |= (grant.read ? kReading : 0u) | (grant.write ? kWriting : 0u);
        if (privileges) granted.emplace(tree, privileges);
    }
    return granted;
}

unsigned OwnersLists::together(const Granted& granted, const std::vector<std::string>& segments) {
    unsigned privileges = 0;
    std::string tree;
    for (size_t level = 0; level <= segments.size() && !granted.empty(); ++level) {
        if (level) tree += (level > 1 ? "/" : "") + segments[level - 1];
        if (const auto found = granted.find(tree); found != granted.end()) privileges |= found->second;
    }
    return privileges;
}

} // namespace rolvane::davacl
