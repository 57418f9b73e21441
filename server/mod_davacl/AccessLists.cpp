#include "server/mod_davacl/AccessLists.h"

#include "server/mod_davacl/Privileges.h"
#include "server/mod_davacl/TreePath.h"

#include <algorithm>
#include <utility>

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

constexpr std::pair<Principal::Kind, std::string_view> kEverybody[] = {
    {Principal::Kind::authenticated, "authenticated"},
    {Principal::Kind::all, "all"},
    {Principal::Kind::unauthenticated, "unauthenticated"}};

std::optional<Principal> parsePrincipal(std::string_view text) {
    for (const auto& [kind, word] : kEverybody)
        if (text == word) return Principal{kind, {}};
    const auto kind = take(text, ' ');
    if (!kind || (*kind != "user" && *kind != "group")) return std::nullopt;
    auto name = percentDecoded(text);
    if (!name || !isUsableName(*name)) return std::nullopt;
    return Principal{*kind == "user" ? Principal::Kind::user : Principal::Kind::group, std::move(*name)};
}

std::string principalText(const Principal& principal) {
    for (const auto& [kind, word] : kEverybody)
        if (principal.kind == kind) return std::string(word);
    return (principal.kind == Principal::Kind::user ? "user " : "group ") + percentEncoded(principal.name, false);
}

bool concerns(const Grant& entry, const Caller& caller) {
    const std::string& name = entry.principal.name;
    switch (entry.principal.kind) {
    case Principal::Kind::authenticated:
    case Principal::Kind::all: return true;
    case Principal::Kind::user: return name == caller.name;
    case Principal::Kind::group: return caller.groupsKnown ? caller.groups.contains(name) : entry.denies;
    case Principal::Kind::unauthenticated: break;
    }
    return false;
}

// The first entry counts: what is decided stays so.
void decide(OwnersLists::Rights& rights, unsigned granted, unsigned denied) {
    rights.granted |= granted & ~rights.denied;
    rights.denied |= denied & ~rights.granted;
}

// The rights of an entry as its line has them, a hyphen in front where it denies.
std::optional<Grant> parseRights(std::string_view text) {
    const bool denies = text.starts_with('-');
    if (denies) text.remove_prefix(1);
    if (text != "r" && text != "w" && text != "rw") return std::nullopt;
    return Grant{{}, text != "w", text != "r", denies};
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
    for (auto known = list.rbegin(); known != list.rend() && known->denies == grant.denies; ++known) {
        if (known->principal != grant.principal) continue;
        known->read = known->read || grant.read;
        known->write = known->write || grant.write;
        return;
    }
    list.push_back(grant);
}

std::optional<OwnersLists> OwnersLists::parse(std::string_view text) {
    OwnersLists lists;
    // Of the last entry of each principal in the list of the tree.
    std::map<std::pair<std::string, Principal>, size_t> places;
    std::map<std::string, size_t> runs; // where the entries of the last kind begin in the list of the tree
    if (take(text, '\n') != kFirstLine) return std::nullopt;
    for (;;) {
        auto line = take(text, '\n');
        if (!line) return std::nullopt;
        if (*line == kLastLine) break;
        const auto path = take(*line, ' ');
        const auto rights = path ? take(*line, ' ') : std::nullopt;
        if (!rights || !path->starts_with('/')) return std::nullopt;
        const auto tree = percentDecoded(path->substr(1));
        auto grant = parseRights(*rights);
        const auto principal = parsePrincipal(*line);
        if (!tree || !principal || !grant) return std::nullopt;
        grant->principal = *principal;
        AccessList& list = lists._lists[*tree];
        if (!list.empty() && list.back().denies != grant->denies) runs[*tree] = list.size();
        const auto [known, isNew] = places.try_emplace({*tree, *principal}, list.size());
        if (isNew || known->second < runs[*tree]) {
            known->second = list.size();
            list.push_back(*grant);
            continue;
        }
        list[known->second].read |= grant->read;
        list[known->second].write |= grant->write;
    }
    if (!text.empty()) return std::nullopt;
    return lists;
}

std::string OwnersLists::text() const {
    std::string out = std::string(kFirstLine) + "\n";
    for (const auto& [tree, list] : _lists)
        for (const Grant& grant : list)
            out += "/" + percentEncoded(tree, true) + (grant.denies ? " -" : " ") + (grant.read ? "r" : "") +
                   (grant.write ? "w" : "") + " " + principalText(grant.principal) + "\n";
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

std::vector<std::string> OwnersLists::trees() const {
    std::vector<std::string> found;
    for (const auto& [tree, list] : _lists) found.push_back(tree);
    return found;
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
        Rights rights;
        for (const Grant& grant : list) {
            if (!concerns(grant, caller)) continue;
            const unsigned bits = (grant.read ? kReading : 0u) | (grant.write ? kWriting : 0u);
            decide(rights, grant.denies ? 0 : bits, grant.denies ? bits : 0);
        }
        if (rights.granted | rights.denied) granted.emplace(tree, rights);
    }
    return granted;
}

unsigned OwnersLists::together(const Granted& granted, const std::vector<std::string>& segments) {
    if (granted.empty()) return 0;
    std::vector<const Rights*> onTheWay;
    std::string tree;
    for (size_t level = 0; level <= segments.size(); ++level) {
        if (level) tree += (level > 1 ? "/" : "") + segments[level - 1];
        if (const auto found = granted.find(tree); found != granted.end()) onTheWay.push_back(&found->second);
    }
    Rights rights;
    for (auto nearest = onTheWay.rbegin(); nearest != onTheWay.rend(); ++nearest)
        decide(rights, (*nearest)->granted, (*nearest)->denied);
    return rights.granted;
}

} // namespace rolvane::davacl
