#include "store/dav/CXACE.h"

#include <algorithm>
#include <array>
#include <string_view>
#include <utility>

namespace rolvane {
namespace {

constexpr std::array<std::string_view, 4> kWriteParts = {"bind", "unbind", "write-content", "write-properties"};

std::optional<CXACE::Principal> kindOf(const CXDAVNode& node) {
    using Kind = CXACE::Principal;
    constexpr std::array<std::pair<std::string_view, Kind>, 6> kinds = {{{"href", Kind::href},
                                                                         {"all", Kind::all},
                                                                         {"authenticated", Kind::authenticated},
                                                                         {"unauthenticated", Kind::unauthenticated},
                                                                         {"property", Kind::property},
                                                                         {"self", Kind::self}}};
    for (const auto& [name, kind] : kinds)
        if (node.string() == name) return kind;
    return std::nullopt;
}

} // namespace

void CXACE::addPrivilegesIn(const CXDAVNode& node) {
    for (const CXDAVNode* privilege : node.childNodesMatchingString("privilege"))
        for (const CXDAVNode& name : privilege->children())
            if (!name.isText()) _privileges.insert(name.string());
}

std::optional<CXACE> CXACE::initWithCurrentUserPrivNode(const CXDAVNode& node) {
    if (node.isText() || node.string() != "current-user-privilege-set") return std::nullopt;
    CXACE ace;
    ace._node = node;
    ace.addPrivilegesIn(node);
    if (ace._privileges.empty()) return std::nullopt;
    return ace;
}

std::optional<CXACE> CXACE::initWithACENode(const CXDAVNode& node) {
    if (node.isText() || node.string() != "ace") return std::nullopt;
    CXACE ace;
    ace._node = node;
    const CXDAVNode* inverted = node.firstChild("invert");
    const CXDAVNode* principal = (inverted ? *inverted : node).firstChild("principal");
    const CXDAVNode* grant = node.firstChild("grant");
    const CXDAVNode* deny = node.firstChild("deny");
    if (!principal || principal->childCount() != 1 || (grant == nullptr) == (deny == nullptr)) return std::nullopt;
    const auto kind = kindOf(principal->childAtIndex(0));
    if (!kind) return std::nullopt;
    ace._principal = *kind;
    if (*kind == Principal::href) ace._href = principal->childAtIndex(0).content();
    ace._grant = grant != nullptr;
    ace._inverted = inverted != nullptr;
    ace._protected = node.firstChild("protected") != nullptr;
    const CXDAVNode* inherited = node.firstChild("inherited");
    ace._inherited = inherited != nullptr;
    if (inherited && inherited->firstChild("href")) ace._inheritedFrom = inherited->firstChild("href")->content();
    ace.addPrivilegesIn(grant ? *grant : *deny);
    return ace;
}

bool CXACE::canRead() const {
    return _privileges.contains("read") || _privileges.contains("all");
}

bool CXACE::canWrite() const {
    return _privileges.contains("write") || _privileges.contains("all") ||
           std::all_of(kWriteParts.begin(), kWriteParts.end(),
                       [this](std::string_view part) { return _privileges.contains(std::string(part)); });
}

bool CXACE::canWriteSomething() const {
    return canWrite() || std::any_of(kWriteParts.begin(), kWriteParts.end(),
                                     [this](std::string_view part) { return _privileges.contains(std::string(part)); });
}

bool CXACE::isPlain() const {
    return std::all_of(_privileges.begin(), _privileges.end(), [](const std::string& privilege) {
        return privilege == "read" || privilege == "write" || privilege == "all" ||
               privilege == "read-current-user-privilege-set" ||
               std::find(kWriteParts.begin(), kWriteParts.end(), privilege) != kWriteParts.end();
    });
}

} // namespace rolvane
