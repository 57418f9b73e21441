#include "store/dav/StoreAccessLists.h"

#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "store/dav/Collections.h"
#include "store/dav/StorePrincipals.h"

#include <algorithm>
#include <memory>
#include <set>

namespace rolvane {
namespace {

constexpr const char* kBody = "<?xml version=\"1.0\" encoding=\"utf-8\" ?><D:propfind xmlns:D=\"DAV:\"><D:prop>"
                              "<D:acl/><D:owner/><D:principal-collection-set/></D:prop></D:propfind>";

bool contains(const std::vector<std::string>& list, const std::string& name) {
    return std::find(list.begin(), list.end(), name) != list.end();
}

void addIfAbsent(std::vector<std::string>& list, const std::string& name) {
    if (!contains(list, name)) list.push_back(name);
}

// `theirs` with what the caller added to and took from `known`.
std::vector<std::string> merged(const std::vector<std::string>& theirs, const std::vector<std::string>& known,
                                const std::vector<std::string>& wanted) {
    std::vector<std::string> all;
    for (const std::string& name : theirs)
        if (!contains(known, name) || contains(wanted, name)) addIfAbsent(all, name);
    for (const std::string& name : wanted)
        if (!contains(known, name)) addIfAbsent(all, name);
    return all;
}

bool sameNames(std::vector<std::string> a, std::vector<std::string> b) {
    std::sort(a.begin(), a.end());
    std::sort(b.begin(), b.end());
    return a == b;
}

// One list belongs to a name whichever scheme it is asked about with.
std::string keyOf(const Url& name) {
    return name.absoluteString().substr(name.scheme().size());
}

std::vector<std::string> hrefsIn(const CXDAVNode* property) {
    std::vector<std::string> hrefs;
    if (property)
        for (const CXDAVNode* href : property->childNodesMatchingString("href")) hrefs.push_back(href->content());
    return hrefs;
}

std::string grantTo(const std::string& href, bool read, bool write) {
    std::string ace = "<D:ace><D:principal><D:href>" + CXDAVNode::escaped(href) + "</D:href></D:principal><D:grant>";
    if (read) ace += "<D:privilege><D:read/></D:privilege>";
    if (write) ace += "<D:privilege><D:write/></D:privilege>";
    return ace + "</D:grant></D:ace>";
}

// The privileges that the denials of a list keep from a principal: a grant behind them gives nothing of it (RFC 3744
// section 6).
class Denials {
public:
    void add(const CXACE& ace) {
        if (!concernsSomebody(ace)) return;
        const std::string whom = concernsEverybody(ace) ? std::string() : ace.href();
        _any.insert(whom);
        if (ace.canRead()) _reading.insert(whom);
        if (ace.canWriteSomething()) _writing.insert(whom);
    }
    bool ofReading(const std::string& href) const { return holds(_reading, href); }
    bool ofWriting(const std::string& href) const { return holds(_writing, href); }
    bool ofAnything(const std::string& href) const { return holds(_any, href); }

private:
    static bool concernsEverybody(const CXACE& ace) {
        return ace.isInverted() || ace.principal() == CXACE::Principal::all ||
               ace.principal() == CXACE::Principal::authenticated;
    }
    static bool concernsSomebody(const CXACE& ace) {
        return !ace.isGrant() && (concernsEverybody(ace) || ace.principal() == CXACE::Principal::href);
    }
    static bool holds(const std::set<std::string>& from, const std::string& href) {
        return from.contains(href) || from.contains(std::string());
    }
    std::set<std::string> _any, _reading, _writing; // hrefs; "" is everybody
};

// The precondition that the server names (RFC 3744 section 8.1.1), for the log.
std::string reasonIn(const HttpResponse& answer) {
    const auto root = parseDAVTree(answer.body);
    const CXDAVNode* error = root ? root->childAtIndex(0).firstChild("error") : nullptr;
    return error && error->childCount() != 0 && !error->childAtIndex(0).isText() ? error->childAtIndex(0).string()
                                                                                 : std::string("no reason given");
}

} // namespace

// The list at one place, as the store has it.
struct StoreAccessLists::OnStore {
    Url asked;
    std::vector<CXACE> entries;   // without the server's own and those of other resources
    std::vector<CXACE> inherited; // those of other resources, without the server's own
    std::string inheritedFrom;    // the one resource that all entries here belong to; "" when there are own ones
    std::string owner;            // the owner's principal, "" when the store does not say
    std::shared_ptr<StorePrincipals> principals;
};

std::optional<StoreAccessLists::OnStore> StoreAccessLists::fetch(const Url& endpoint) {
    HttpRequest request = StoreSession::propfind(endpoint, 0);
    request.body = std::make_shared<const std::string>(kBody);
    request.limits.maxBodyBytes = 8u << 20;
    const HttpResponse answer = _session.send(std::move(request));
    const auto root = answer.complete() && answer.status == 207 ? parseDAVTree(answer.body) : std::nullopt;
    const auto responses = root ? davResponses(*root) : std::nullopt;
    if (!responses || responses->size() != 1) return std::nullopt;
    const CXDAVNode& response = *responses->front();
    const CXDAVNode* list = davProperty(response, "acl");
    if (!list) return std::nullopt;

    OnStore found;
    const CXDAVNode* href = response.firstChild("href");
    found.asked = href && href->content().ends_with('/') ? namedAsCollection(endpoint) : endpoint;
    found.principals = std::make_shared<StorePrincipals>(_session, endpoint, href ? href->content() : std::string(),
                                                         hrefsIn(davProperty(response, "principal-collection-set")));
    const auto owners = hrefsIn(davProperty(response, "owner"));
    if (!owners.empty()) found.owner = owners.front();
    std::set<std::string> sources;
    for (const CXDAVNode* node : list->childNodesMatchingString("ace")) {
        const auto ace = CXACE::initWithACENode(*node);
        if (!ace) return std::nullopt; // to set the list without an entry that is not understood would take it away
        sources.insert(ace->inheritedFrom());
        if (ace->isProtected()) continue;
        if (ace->principal() == CXACE::Principal::href) found.principals->learn(ace->href());
        (ace->isInherited() ? found.inherited : found.entries).push_back(*ace);
    }
    if (sources.size() == 1) found.inheritedFrom = *sources.begin();
    return found;
}

// The list that a place without one of its own inherits, if it is the parent's and of the same owner.
std::optional<StoreAccessLists::OnStore> StoreAccessLists::fetchParent(const OnStore& below) {
    const auto parent = below.principals->resolved(below.inheritedFrom);
    if (!parent || below.inheritedFrom.empty() || below.owner.empty()) return std::nullopt;
    const auto components = parent->pathComponents();
    auto expected = below.asked.pathComponents();
    if (expected.empty()) return std::nullopt;
    expected.pop_back();
    if (components != expected) return std::nullopt;
    auto found = fetch(*parent);
    if (!found || found->owner != below.owner || !found->inheritedFrom.empty()) return std::nullopt;
    return found;
}

bool StoreAccessLists::isOurs(const OnStore& found, const CXACE& ace) const {
    if (!ace.isGrant() || ace.isInverted() || ace.principal() != CXACE::Principal::href || !ace.isPlain()) return false;
    const std::string name = found.principals->nameFor(ace.href());
    return !name.empty() && ace.href() != found.owner && name != found.principals->nameFor(found.owner) &&
           name != _session.account().user.str();
}

AccessLists StoreAccessLists::listsOf(const OnStore& found) const {
    AccessLists lists;
    Denials before;
    for (const CXACE& ace : found.inheritedFrom.empty() ? found.entries : found.inherited) {
        before.add(ace);
        if (!isOurs(found, ace)) continue;
        const std::string name = found.principals->nameFor(ace.href());
        if (ace.canRead() && !before.ofReading(ace.href())) addIfAbsent(lists.readers, name);
        if (ace.canWrite() && !before.ofWriting(ace.href())) addIfAbsent(lists.writers, name);
    }
    return lists;
}

std::optional<AccessLists> StoreAccessLists::read(const Url& name, bool securely) {
    const auto target = placeOf(name, securely);
    if (!target || _session.keepsAccessLists() == false) return std::nullopt;
    const auto found = fetch(*target);
    if (!found) return std::nullopt;
    AccessLists lists = listsOf(*found);
    const Lock guard(_mutex);
    return _known[keyOf(name)] = std::move(lists);
}

std::optional<Url> StoreAccessLists::placeOf(const Url& name, bool securely) const {
    return isAlwaysCollection(name) ? _session.collectionEndpoint(name, securely) : _session.endpoint(name, securely);
}

// Takes out whom the store does not know; false when there was somebody.
bool StoreAccessLists::dropUnknown(const Url& name, OnStore& found, std::vector<std::string>& list) {
    return 0 == std::erase_if(list, [&](const std::string& who) {
               if (found.principals->hrefFor(who)) return false;
               CXLog("The store knows nobody called \"%@\": the access list of %@ goes without.", who, name);
               return true;
           });
}

// The entries in their order, because the first one that decides counts (RFC 3744 section 6). Those of names stay where
// they are, unless a denial before them takes what they are to grant; such ones and new names come last, but before the
// first denial that concerns them.
std::string StoreAccessLists::entriesWith(const OnStore& found, const AccessLists& wanted) const {
    std::vector<std::string> missing = wanted.readers;
    for (const std::string& writer : wanted.writers) addIfAbsent(missing, writer);
    const auto entryFor = [&](const std::string& who) {
        std::erase(missing, who);
        return grantTo(found.principals->hrefFor(who).value_or(std::string()), contains(wanted.readers, who),
                       contains(wanted.writers, who));
    };
    struct Entry {
        std::string xml;
        Denials denials; // its own
    };
    std::vector<Entry> entries;
    Denials before;
    for (const CXACE& ace : found.entries) {
        before.add(ace);
        if (!isOurs(found, ace)) {
            entries.push_back({ace.xml(), {}});
            entries.back().denials.add(ace);
            continue;
        }
        const std::string name = found.principals->nameFor(ace.href());
        const bool taken = (contains(wanted.readers, name) && before.ofReading(ace.href())) ||
                           (contains(wanted.writers, name) && before.ofWriting(ace.href()));
        if (contains(missing, name) && !taken) entries.push_back({entryFor(name), {}});
    }
    for (const std::string& who : std::vector<std::string>(missing)) {
        const std::string href = found.principals->hrefFor(who).value_or(std::string());
        const auto place = std::find_if(entries.begin(), entries.end(),
                                        [&](const Entry& entry) { return entry.denials.ofAnything(href); });
        entries.insert(place, {entryFor(who), {}});
    }
    std::string all;
    for (const Entry& entry : entries) all += entry.xml;
    return all;
}

HttpResponse StoreAccessLists::send(OnStore& found, const AccessLists& wanted) {
    const std::string body =
        "<?xml version=\"1.0\" encoding=\"utf-8\" ?><D:acl xmlns:D=\"DAV:\">" + entriesWith(found, wanted) + "</D:acl>";
    HttpRequest request = StoreSession::request("ACL", found.asked);
    request.headers = {{"Content-Type", "application/xml; charset=utf-8"}};
    request.body = std::make_shared<const std::string>(body);
    return _session.send(std::move(request), [](int) { return true; });
}

bool StoreAccessLists::sendOrInherit(const Url& name, OnStore& found, const AccessLists& wanted) {
    HttpResponse answer = send(found, wanted);
    if (answer.status == 403 && !found.inheritedFrom.empty())
        if (auto parent = fetchParent(found)) answer = send(*parent, wanted);
    if (answer.ok()) return true;
    _session.noteFailure("ACL", found.asked, answer);
    CXLog("The access list of %@ could not be set: %@", name,
          answer.complete() ? std::to_string(answer.status) + ", " + reasonIn(answer) : answer.detail);
    return false;
}

bool StoreAccessLists::set(const Url& name, bool securely, const AccessLists& asked) {
    const std::string key = keyOf(name);
    AccessLists wanted = asked;
    // The owner needs no entry: the store has its own for that.
    for (auto* list : {&wanted.readers, &wanted.writers})
        std::erase_if(*list, [this](const std::string& who) {
            return who == kSelf.str() || who == _session.account().user.str();
        });
    std::optional<AccessLists> known;
    {
        const Lock guard(_mutex);
        if (const auto seen = _known.find(key); seen != _known.end()) known = seen->second;
    }
    if (known == wanted) return true;
    const auto target = placeOf(name, securely);
    auto found = target && _session.keepsAccessLists() != false ? fetch(*target) : std::nullopt;
    if (!found) return false;
    const AccessLists theirs = listsOf(*found);
    AccessLists next = wanted;
    if (known)
        next = {merged(theirs.readers, known->readers, wanted.readers),
                merged(theirs.writers, known->writers, wanted.writers)};
    const bool readersKnown = dropUnknown(name, *found, next.readers);
    const bool complete = dropUnknown(name, *found, next.writers) && readersKnown;
    const bool isThere = sameNames(next.readers, theirs.readers) && sameNames(next.writers, theirs.writers);
    if (!isThere && !sendOrInherit(name, *found, next)) return false;
    if (!complete) return false;
    const Lock guard(_mutex);
    _known[key] = std::move(wanted);
    return true;
}

} // namespace rolvane
