#pragma once

#include "server/mod_davacl/AclBody.h"
#include "server/mod_davacl/Privileges.h"
#include "server/mod_davacl/TreePath.h"
#include "store/dav/CXACE.h"
#include "store/dav/CXDAVNode.h"

#include <cstdint>
#include <stdexcept>
#include <string>
#include <vector>

#include <apr_general.h>
#include <apr_pools.h>

namespace rolvane::fuzz {

class AprPool {
public:
    AprPool() {
        static const bool ready = apr_initialize() == APR_SUCCESS;
        if (!ready || apr_pool_create(&_pool, nullptr) != APR_SUCCESS) throw std::runtime_error("no pool");
    }
    ~AprPool() { apr_pool_destroy(_pool); }
    AprPool(const AprPool&) = delete;
    AprPool& operator=(const AprPool&) = delete;
    operator apr_pool_t*() const { return _pool; }

private:
    apr_pool_t* _pool = nullptr;
};

// As httpd reads a body; null when it is not well formed. It lives as long as the pool.
inline apr_xml_doc* readXml(const AprPool& pool, const uint8_t* data, size_t size) {
    apr_xml_parser* parser = apr_xml_parser_create(pool);
    apr_xml_doc* doc = nullptr;
    const bool fed = apr_xml_parser_feed(parser, reinterpret_cast<const char*>(data), size) == APR_SUCCESS;
    return apr_xml_parser_done(parser, &doc) == APR_SUCCESS && fed ? doc : nullptr;
}

inline std::string trimmedText(std::string_view text) {
    constexpr std::string_view blank = " \t\r\n";
    text.remove_prefix(std::min(text.find_first_not_of(blank), text.size()));
    return std::string(text.substr(0, text.find_last_not_of(blank) + 1));
}

inline std::optional<davacl::Principal> principalNamed(const std::string& href) {
    using Kind = davacl::Principal::Kind;
    for (const auto& [prefix, kind] : {std::pair("/p/users/", Kind::user), std::pair("/p/groups/", Kind::group)})
        if (href.starts_with(prefix) && davacl::isUsableName(href.substr(std::string(prefix).size())))
            return davacl::Principal{kind, href.substr(std::string(prefix).size())};
    return std::nullopt;
}

// Whether the caller gets the privilege by the entries as another reader has them, one after the other.
inline bool mayByTheEntries(const std::vector<CXACE>& entries, const davacl::Caller& who, bool write) {
    for (const CXACE& ace : entries) {
        if (!(write ? ace.canWrite() : ace.canRead())) continue;
        bool concerns = ace.principal() == CXACE::Principal::all || ace.principal() == CXACE::Principal::authenticated;
        if (ace.principal() == CXACE::Principal::href) {
            const auto named = principalNamed(trimmedText(ace.href()));
            if (!named) throw std::logic_error("an entry for nobody was taken");
            concerns = named->kind == davacl::Principal::Kind::user ? named->name == who.name
                                                                    : who.groups.contains(named->name);
        }
        if (concerns) return ace.isGrant();
    }
    return false;
}

// Any body of an ACL request is refused or gives a list that can be kept and grants what another reader of the same XML
// finds in it. Throws std::logic_error when that does not hold.
inline void checkAclBody(const uint8_t* data, size_t size) {
    const AprPool pool;
    const apr_xml_doc* doc = readXml(pool, data, size);
    const davacl::AclPlace place{"owner", {"/dav/owner/"}, 20, principalNamed};
    davacl::AccessList list;
    if (readAclBody(doc, place, list)) return;
    if (list.size() > 20) throw std::logic_error("a list with more entries than it may have");
    davacl::OwnersLists lists;
    lists.set("", list);
    if (davacl::OwnersLists::parse(lists.text()) != lists) throw std::logic_error("a list that cannot be kept");
    const auto tree = parseDAVTree({reinterpret_cast<const char*>(data), size});
    if (!tree) return; // that reader is stricter
    std::vector<CXACE> entries;
    for (const CXDAVNode* node : tree->childAtIndex(0).childAtIndex(0).childNodesMatchingString("ace")) {
        const auto ace = CXACE::initWithACENode(*node);
        if (ace && (ace->isProtected() || ace->isInherited())) continue;
        if (!ace) throw std::logic_error("an entry was taken that another reader does not understand");
        entries.push_back(*ace);
    }
    for (const davacl::Caller& who : {davacl::Caller{"a", {}}, davacl::Caller{"b", {"a"}}})
        for (const bool write : {false, true})
            if (((lists.granted(who, {}) & (write ? davacl::kBind : davacl::kRead)) != 0) !=
                mayByTheEntries(entries, who, write))
                throw std::logic_error("a list grants something else than its body says");
}

} // namespace rolvane::fuzz
