#pragma once

#include <map>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane::davacl {

struct Principal {
    enum class Kind { user, group, authenticated, all, unauthenticated };
    Kind kind = Kind::user;
    std::string name; // of users and groups, "" for the others
    auto operator<=>(const Principal&) const = default;
};

// An entry: what it grants to the principal, or denies.
struct Grant {
    Principal principal;
    bool read = false, write = false, denies = false;
    bool operator==(const Grant&) const = default;
};

// In the order in which they were named, which is the order in which they are looked at (RFC 3744 section 6): of a
// grant and a denial of one privilege the first counts. Between two entries of the other kind a principal occurs once.
using AccessList = std::vector<Grant>;
void addGrant(AccessList& list, const Grant& grant); // joins it with one that counts at the same time

// Who asks. Nobody is authenticated under an empty name.
struct Caller {
    std::string name;
    std::set<std::string> groups;
    bool groupsKnown = true; // else what is denied to a group is denied to everybody
};

// All the lists of one owner: one for each collection that has one, by its path below the owner's ("" for the owner's
// root). A plain value. As a text:
//   file  = "davacl 1" LF *( entry LF ) "end" LF
//   entry = "/" path SP [ "-" ] ( "r" / "w" / "rw" ) SP ( ( "user" / "group" ) SP name / everybody )
//   everybody = "authenticated" / "all" / "unauthenticated"
// A hyphen: the entry denies.
// path and name have everything but letters, digits and "-._~@+" (and the slashes of a path) percent-encoded.
class OwnersLists {
public:
    // Nothing when the text is not of this form to the last byte: a list that is not understood grants nothing.
    static std::optional<OwnersLists> parse(std::string_view text);
    std::string text() const;

    const AccessList& at(const std::string& tree) const; // empty when there is none
    void set(const std::string& tree, AccessList list);
    // The lists of the tree and of everything below go. False when there was none.
    bool drop(const std::string& tree);
    // The lists of the tree and below belong to another path from now on; what was there goes.
    void move(const std::string& from, const std::string& to);
    bool has(const std::string& tree) const; // the tree or anything below has one
    bool empty() const { return _lists.empty(); }
    std::vector<std::string> trees() const; // that have a list
    bool mentionsGroups() const;

    // The privileges that each list grants to the caller and denies, by the list's tree. Every entry is looked at once,
    // however many places are asked about later.
    struct Rights {
        unsigned granted = 0, denied = 0; // no bit is in both
    };
    using Granted = std::map<std::string, Rights, std::less<>>;
    Granted grantedTo(const Caller& caller) const;
    // The privileges that all lists on the way down to the tree grant together. Of two lists that disagree the nearer
    // one counts.
    static unsigned together(const Granted& granted, const std::vector<std::string>& segments);
    unsigned granted(const Caller& caller, const std::vector<std::string>& segments) const {
        return together(grantedTo(caller), segments);
    }

    bool operator==(const OwnersLists&) const = default;

private:
    std::map<std::string, AccessList> _lists; // none of them empty
};

// Everything but letters, digits and "-._~@+" (and the slash, if asked) as %XX. The reverse takes nothing else.
std::string percentEncoded(std::string_view text, bool keepSlashes);
std::optional<std::string> percentDecoded(std::string_view text);

} // namespace rolvane::davacl
