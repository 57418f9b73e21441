#include "acl/CXDAVACLManager.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "store/dav/CXDAVManager.h"
#include "store/dav/CXDAVQuery.h"

#include <algorithm>
#include <functional>

namespace rolvane {
namespace {

constexpr const char* kAllGroup = "AllCXGroup"; // what a subscriber's rights are asked about
constexpr const char *kPrincipal = "principal", *kAllAccess = "allAccess", *kGrant = "grant",
                     *kOneListOnly = "oneListOnly";
constexpr std::string_view kPrivilegeSet = "current-user-privilege-set";
constexpr std::string_view kResourceSet = "access-control-resource-set";

std::string bodyAsking(const std::string& property) {
    return "<?xml version=\"1.0\" encoding=\"utf-8\" ?><D:propfind xmlns:D=\"DAV:\">\n<D:prop>\n" + property +
           "\n</D:prop>\n</D:propfind>";
}

char lower(char c) {
    return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
}

bool mentions(const std::string& text, std::string_view what) {
    return std::search(text.begin(), text.end(), what.begin(), what.end(),
                       [](char a, char b) { return lower(a) == lower(b); }) != text.end();
}

// The responses of an answer; nothing unless it is one document with one multistatus that has some.
std::optional<std::vector<const CXDAVNode*>> responsesIn(const CXDAVNode& root) {
    if (root.childCount() != 1 || root.childAtIndex(0).childCount() != 1) return std::nullopt;
    const auto multistatus = root.childAtIndex(0).childNodesMatchingString("multistatus");
    if (multistatus.size() != 1) return std::nullopt;
    auto responses = multistatus.front()->childNodesMatchingString("response");
    if (responses.empty()) return std::nullopt;
    return responses;
}

// The location that a response speaks of, decoded; nothing when it names none.
std::optional<std::string> locationOf(const CXDAVNode& response) {
    const CXDAVNode* href = response.firstChild("href");
    if (!href || href->childCount() == 0) return std::nullopt;
    return Url::percentDecode(href->childAtIndex(0).string());
}

void forEachProperty(const CXDAVNode& response, std::string_view name,
                     const std::function<void(const CXDAVNode&)>& call) {
    for (const CXDAVNode* propstat : response.childNodesMatchingString("propstat"))
        for (const CXDAVNode* prop : propstat->childNodesMatchingString("prop"))
            for (const CXDAVNode& property : prop->children())
                if (mentions(property.string(), name)) call(property);
}

// The base location's server with the text as the one component of its path.
std::optional<Url> besideOrigin(const Url& base, const std::string& component) {
    const auto server = Url::parse(base.origin() + "/");
    if (!server || component.empty()) return std::nullopt;
    return server->cxURLByAppendingComponent(component);
}

std::vector<std::string> texts(const std::vector<UserName>& users) {
    std::vector<std::string> all;
    for (const UserName& user : users) all.push_back(user.str());
    return all;
}

std::vector<UserName> users(const std::vector<std::string>& names) {
    return {names.begin(), names.end()};
}

} // namespace

CXDAVACLManager::CXDAVACLManager(Url baseLocation, const LocationOwner& owner, CXDAVManager& manager)
    : CXACLManager(std::move(baseLocation), owner), _manager(manager) {
    CXDAVACLManager::load();
}

std::string CXDAVACLManager::currentUserPrivilegesBody() {
    return bodyAsking("<D:current-user-privilege-set/>");
}

std::string CXDAVACLManager::resourceSetBody() {
    return bodyAsking("<access-control-resource-set xmlns=\"" + std::string(kStoreNamespace) + "\"/>");
}

bool CXDAVACLManager::load() {
    return _loaded = _publisher ? publisherLoad() : subscriberLoad();
}

bool CXDAVACLManager::publisherLoad() {
    std::vector<std::string> readers, writers;
    if (!_manager.ACLsAtURL(_baseLocation.withScheme("https"), readers, writers)) return false;
    _readAccessPrincipals = users(readers);
    _allAccessPrincipals = users(writers);
    return true;
}

std::optional<CXDAVNode> CXDAVACLManager::ask(const Url& target, std::string body) {
    CXDAVQuery query(_manager, target.withScheme("https"));
    query.setUserAgent(CXDAVManager::ostrelUserAgent());
    query.setDepth(CXDAVQuery::kUnboundedDepth);
    query.setQueryType(CXDAVQuery::kPropfind);
    query.setBody(std::move(body));
    auto root = query.execute();
    return query.succeeded() ? std::move(root) : std::nullopt;
}

std::optional<CXDAVACLManager::CurrentUserRights> CXDAVACLManager::rightsIn(const CXDAVNode& root) {
    const auto responses = responsesIn(root);
    if (!responses) return std::nullopt;
    CurrentUserRights rights;
    for (const CXDAVNode* response : *responses)
        if (locationOf(*response))
            forEachProperty(*response, kPrivilegeSet, [&rights](const CXDAVNode& property) {
                const auto ace = CXACE::initWithCurrentUserPrivNode(property);
                rights.mayWrite = rights.mayWrite || (ace && ace->canWrite());
            });
    return rights;
}

bool CXDAVACLManager::subscriberLoad() {
    const auto root = ask(_baseLocation.cxURLByAppendingComponent(kAllGroup), currentUserPrivilegesBody());
    const auto rights = root ? rightsIn(*root) : std::nullopt;
    if (!rights) return false;
    grantPrincipal(kSelf, false);
    if (rights->mayWrite) grantPrincipal(kSelf, true);
    return true;
}

std::optional<std::map<std::string, CXDAVACLManager::Resource>> CXDAVACLManager::resourcesIn(const CXDAVNode& root,
                                                                                             const Url& base) {
    const auto responses = responsesIn(root);
    if (!responses) return std::nullopt;
    std::map<std::string, Resource> resources;
    for (const CXDAVNode* response : *responses) {
        const auto location = locationOf(*response);
        if (!location) continue;
        Resource& resource = resources[*location];
        forEachProperty(*response, kResourceSet, [&](const CXDAVNode& property) {
            for (const CXDAVNode& entry : property.children()) {
                const CXDAVNode* href = entry.firstChild("href");
                if (href && href->childCount() != 0)
                    if (const auto url = besideOrigin(base, Url::percentDecode(href->children().back().string())))
                        resource.members.push_back(*url);
                for (const CXDAVNode* node : entry.childNodesMatchingString("ace"))
                    if (const auto ace = CXACE::initWithACENode(*node)) resource.entries.push_back(*ace);
            }
        });
    }
    return resources;
}

bool CXDAVACLManager::publisherLoadResourceSet() {
    const auto root = ask(_baseLocation, resourceSetBody());
    return root && resourcesIn(*root, _baseLocation);
}

// A change that is asked for again undoes what came between, so that the earlier one makes no difference any more.
void CXDAVACLManager::willChange(const Change& change) {
    if (!_publisher) return;
    std::erase(_unsaved, change);
    _unsaved.push_back(change);
}

Array CXDAVACLManager::unsaved() const {
    Array all;
    for (const Change& change : _unsaved)
        all.append(Dictionary{{kPrincipal, change.principal},
                              {kAllAccess, change.allAccess},
                              {kGrant, change.grant},
                              {kOneListOnly, change.oneListOnly}});
    return all;
}

void CXDAVACLManager::resume(const Array& changes) {
    for (const Value& each : changes) {
        const Dictionary stored = each.dictionary();
        const Change change{UserName(stored[kPrincipal].string()), stored[kAllAccess].boolean(),
                            stored[kGrant].boolean(), stored[kOneListOnly].boolean()};
        if (change.principal.empty()) continue;
        willChange(change);
        carryOut(change);
    }
}

std::vector<UserName> CXDAVACLManager::deniedIn(const Array& changes) {
    std::vector<UserName> names;
    for (const Value& each : changes) {
        const UserName principal(each.dictionary()[kPrincipal].string());
        if (!each.dictionary()[kGrant].boolean() && std::find(names.begin(), names.end(), principal) == names.end())
            names.push_back(principal);
    }
    return names;
}

bool CXDAVACLManager::save() {
    if (!_publisher) return true;
    CXACLManager::save();
    return saveSimpleACL();
}

bool CXDAVACLManager::saveSimpleACL() {
    if (!_publisher) return true;
    try {
        if (!_loaded) {
            if (_unsaved.empty() || !load()) return false;
            for (const Change& change : _unsaved) carryOut(change);
        }
        if (!_manager.setACLsWithReadPrincipals(texts(_readAccessPrincipals), texts(_allAccessPrincipals),
                                                _baseLocation))
            return false;
        _unsaved.clear();
        return true;
    } catch (const CXException& exception) {
        CXLog("Exception saving ACL: %@", exception);
        return false;
    }
}

} // namespace rolvane
