#include "server/mod_davacl/AclBody.h"

#include "server/mod_davacl/Privileges.h"
#include "server/mod_davacl/XmlElements.h"

#include <algorithm>
#include <iterator>

namespace rolvane::davacl {
namespace {

bool namesOwner(const AclPlace& place, const apr_xml_elem* principal) {
    if (const apr_xml_elem* property = child(principal, "property")) return child(property, "owner");
    const apr_xml_elem* href = child(principal, "href");
    const auto named = href ? place.principalAt(textOf(href)) : std::nullopt;
    return named && *named == Principal{Principal::Kind::user, place.owner};
}

// An entry that was read here and came back as it was is not set again; a changed one is refused.
std::optional<Unmet> checkProtected(const AclPlace& place, const apr_xml_elem* ace) {
    if (!namesOwner(place, child(ace, "principal")) || child(ace, "deny"))
        return Unmet{"no-protected-ace-conflict", "The owner's own entry cannot be changed."};
    return std::nullopt;
}

const apr_xml_elem* principalOf(const apr_xml_elem* ace) {
    const apr_xml_elem* inverted = child(ace, "invert");
    return child(inverted ? inverted : ace, "principal");
}

// RFC 3744 section 5.5.1.
bool isOfAKnownKind(const apr_xml_elem* principal) {
    constexpr const char* kKinds[] = {"href", "all", "authenticated", "unauthenticated", "property", "self"};
    return std::any_of(std::begin(kKinds), std::end(kKinds),
                       [&](const char* kind) { return child(principal, kind) != nullptr; });
}

std::optional<Unmet> checkInherited(const AclPlace& place, const apr_xml_elem* ace) {
    if (!isOfAKnownKind(principalOf(ace)))
        return Unmet{"allowed-principal", "The principal of an inherited entry is of no known kind."};
    const apr_xml_elem* href = child(child(ace, "inherited"), "href");
    if (href && std::find(place.above.begin(), place.above.end(), textOf(href)) != place.above.end())
        return std::nullopt;
    return Unmet{"no-inherited-ace-conflict", "An inherited entry is set where it comes from."};
}

// Everybody of a kind. Nobody has a right without a name, so a grant to whoever has none would say more than it does.
std::optional<Principal> kindOfEverybody(const apr_xml_elem* principal, bool denies) {
    if (child(principal, "authenticated")) return Principal{Principal::Kind::authenticated, {}};
    if (child(principal, "all")) return Principal{Principal::Kind::all, {}};
    if (denies && child(principal, "unauthenticated")) return Principal{Principal::Kind::unauthenticated, {}};
    return std::nullopt;
}

// Whom the entry is for; nothing with `unmet` set when it may not be for them.
std::optional<Principal> readPrincipal(const AclPlace& place, const apr_xml_elem* principal, bool denies,
                                       std::optional<Unmet>& unmet) {
    if (auto everybody = kindOfEverybody(principal, denies)) return everybody;
    const apr_xml_elem* href = child(principal, "href");
    if (child(child(principal, "property"), "owner")) return Principal{Principal::Kind::user, place.owner};
    if (!href) {
        unmet = Unmet{"allowed-principal", "Entries are for users, groups, the owner, DAV:authenticated and DAV:all."};
        return std::nullopt;
    }
    auto named = place.principalAt(textOf(href));
    if (!named) unmet = Unmet{"recognized-principal", "This server does not know the principal."};
    return named;
}

std::optional<Unmet> readPrivileges(const apr_xml_elem* grant, Grant& into) {
    bool any = false;
    for (const apr_xml_elem* privilege = grant->first_child; privilege; privilege = privilege->next) {
        if (!isDav(privilege, "privilege") || !privilege->first_child)
            return Unmet{nullptr, "DAV:grant and DAV:deny hold DAV:privilege elements."};
        for (const apr_xml_elem* name = privilege->first_child; name; name = name->next) {
            const PrivilegeUse use = name->ns == APR_XML_NS_DAV_ID ? useOf(name->name) : PrivilegeUse::unknown;
            if (use == PrivilegeUse::abstract)
                return Unmet{"no-abstract", "Only DAV:read and DAV:write can be granted and denied."};
            if (use == PrivilegeUse::unknown)
                return Unmet{"not-supported-privilege", "Only DAV:read and DAV:write can be granted and denied."};
            (isDav(name, "read") ? into.read : into.write) = true;
            any = true;
        }
    }
    return any ? std::nullopt : std::optional(Unmet{nullptr, "DAV:grant or DAV:deny is empty."});
}

// RFC 3744 section 5.5: one principal, who is one, and either grants or denials.
bool isWellFormed(const apr_xml_elem* ace) {
    const size_t principals = countOf(ace, "principal") + countOf(ace, "invert");
    const apr_xml_elem* principal = principalOf(ace);
    if (principals != 1 || elementsIn(principal) != 1 || !textOf(principal).empty() ||
        countOf(ace, "grant") + countOf(ace, "deny") != 1)
        return false;
    const apr_xml_elem* property = child(principal, "property");
    return !property || elementsIn(property) == 1;
}

std::optional<Unmet> readEntry(const AclPlace& place, const apr_xml_elem* ace, AccessList& list) {
    if (!isWellFormed(ace))
        return Unmet{nullptr,
                     "DAV:ace holds one DAV:principal, with one element in it, and one DAV:grant or DAV:deny."};
    if (child(ace, "protected")) return checkProtected(place, ace);
    if (child(ace, "inherited")) return checkInherited(place, ace);
    if (child(ace, "invert")) return Unmet{"no-invert", "Inverted principals are not supported."};
    const apr_xml_elem* deny = child(ace, "deny");
    Grant asked;
    asked.denies = deny != nullptr;
    std::optional<Unmet> unmet;
    const auto who = readPrincipal(place, child(ace, "principal"), asked.denies, unmet);
    if (!who) return unmet;
    if (auto wrong = readPrivileges(deny ? deny : child(ace, "grant"), asked)) return wrong;
    asked.principal = *who;
    if (*who != Principal{Principal::Kind::user, place.owner})
        addGrant(list, asked);
    else if (asked.denies)
        return Unmet{"no-protected-ace-conflict", "The owner cannot be denied anything."};
    return std::nullopt; // a grant to the owner adds nothing to what the owner has
}

} // namespace

std::optional<Unmet> readAclBody(const apr_xml_doc* doc, const AclPlace& place, AccessList& list) {
    if (!doc || !isDav(doc->root, "acl")) return Unmet{nullptr, "The body must be a DAV:acl."};
    // Before anybody is asked who they are: each entry may cost a look-up.
    if (countOf(doc->root, "ace") > place.mostEntries)
        return Unmet{"limited-number-of-aces",
                     "A list holds at most " + std::to_string(place.mostEntries) + " entries."};
    for (const apr_xml_elem* e = doc->root->first_child; e; e = e->next) {
        if (!isDav(e, "ace")) continue;
        if (auto unmet = readEntry(place, e, list)) return unmet;
    }
    return std::nullopt;
}

} // namespace rolvane::davacl
