#pragma once

#include "server/mod_davacl/AccessLists.h"
#include "server/mod_davacl/GroupFile.h"
#include "server/mod_davacl/Privileges.h"
#include "server/mod_davacl/TreePath.h"

#include <cstdint>
#include <sstream>
#include <stdexcept>
#include <string>
#include <vector>

namespace rolvane::fuzz {

inline std::vector<std::string> segmentsOf(const std::string& path) {
    std::vector<std::string> all;
    std::istringstream parts(path);
    for (std::string part; std::getline(parts, part, '/');)
        if (!part.empty()) all.push_back(part);
    return all;
}

// The rule of RFC 3744 section 6 for one privilege, with the lines of the file as they stand: the first entry that
// concerns the caller decides, the nearest list first.
inline bool mayByTheLines(const std::string& text, const std::vector<std::string>& way, const davacl::Caller& who,
                          char privilege) {
    for (size_t level = way.size() + 1; level-- > 0;) {
        std::string tree;
        for (size_t i = 0; i < level; ++i) tree += (i ? "/" : "") + way[i];
        std::istringstream lines(text);
        for (std::string line; std::getline(lines, line);) {
            std::istringstream words(line);
            std::string path, rights, kind, name;
            words >> path >> rights >> kind >> name;
            if (path.empty() || path[0] != '/' || davacl::percentDecoded(path.substr(1)) != tree) continue;
            const bool denies = rights[0] == '-';
            const std::string named = davacl::percentDecoded(name).value_or("");
            const bool concerns = kind == "authenticated" || kind == "all" || (kind == "user" && named == who.name) ||
                                  (kind == "group" && who.groups.contains(named));
            if (concerns && rights.find(privilege) != std::string::npos) return !denies;
        }
    }
    return false;
}

inline void checkRights(const std::string& text, const davacl::OwnersLists& lists) {
    const davacl::Caller callers[] = {{"a", {}}, {"b", {"a"}}, {"c", {"a", "b"}}};
    for (const davacl::Caller& who : callers)
        for (const std::vector<std::string>& way : std::initializer_list<std::vector<std::string>>{
                 {}, {"a"}, {"a", "b"}, {"Contacts"}, {"Contacts", "People", "7"}}) {
            const unsigned granted = lists.granted(who, way);
            if (((granted & davacl::kRead) != 0) != mayByTheLines(text, way, who, 'r') ||
                ((granted & davacl::kBind) != 0) != mayByTheLines(text, way, who, 'w'))
                throw std::logic_error("a list grants something else than its lines say");
        }
}

inline void checkPath(const std::string& path) {
    const auto place = davacl::TreePath::of("/dav", "/dav/" + path);
    if (!place) throw std::logic_error("a place below the base is none");
    auto segments = segmentsOf(path);
    const std::string owner = segments.empty() ? std::string() : segments.front();
    if (!segments.empty()) segments.erase(segments.begin());
    if (place->owner != owner || place->below != segments) throw std::logic_error("a path names another place");
    if (!place->isWithin(place->parent())) throw std::logic_error("a place is not within what holds it");
    if (path.empty() || path[0] != '/')
        if (davacl::TreePath::of("/dav", "/dav" + path).has_value() != path.empty())
            throw std::logic_error("a place beside the base counts as below it");
    if (davacl::percentDecoded(davacl::percentEncoded(path, false)) != path ||
        davacl::percentDecoded(davacl::percentEncoded(path, true)) != path)
        throw std::logic_error("what was encoded decodes to something else");
    for (const std::string& segment : segments)
        if (davacl::isUsableName(segment) && (segment == ".." || segment.find('\n') != std::string::npos))
            throw std::logic_error("a name leaves its directory or its line");
}

inline void checkGroups(const std::string& text) {
    for (const std::string& group : davacl::groupsIn(text))
        for (const std::string& user : davacl::usersIn(group, text))
            if (!davacl::groupsOf(user, text).contains(group))
                throw std::logic_error("a member of a group is not in it");
}

// Any text as a file of access lists, as a path below the base and as a group file. Lists are understood to the last
// byte or not at all, read back as they were written, and grant what their lines say. Throws std::logic_error when that
// does not hold.
inline void checkAccessLists(const uint8_t* data, size_t size) {
    const std::string text(reinterpret_cast<const char*>(data), size);
    checkPath(text);
    checkGroups(text);
    const auto lists = davacl::OwnersLists::parse(text);
    if (!lists) return;
    if (davacl::OwnersLists::parse(lists->text()) != lists)
        throw std::logic_error("lists that were written read back as others");
    checkRights(text, *lists);
    checkRights(lists->text(), *lists);
}

} // namespace rolvane::fuzz
