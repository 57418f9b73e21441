#include "server/mod_davacl/SyncCollection.h"

#include "server/mod_davacl/Access.h"
#include "server/mod_davacl/DiskMembers.h"
#include "server/mod_davacl/LiveProperties.h"
#include "server/mod_davacl/PrincipalResources.h"
#include "server/mod_davacl/SyncRequest.h"
#include "server/mod_davacl/TreeJournal.h"
#include "server/mod_davacl/XmlElements.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <ctime>

namespace rolvane::davacl {
namespace {

constexpr uint64_t kMostResponses = 5000;
constexpr size_t kMostBytes = 8u << 20;

struct Asked {
    request_rec* r;
    const Configuration& c;
    TreePath place;
    std::string directory;
};

std::optional<Asked> askedOf(request_rec* r, const dav_resource* collection) {
    const Configuration* c = configurationOf(r);
    auto place = c && collection->uri ? TreePath::of(c->base, collection->uri) : std::nullopt;
    if (!place || place->isBase() || !collection->exists || !collection->collection) return std::nullopt;
    const auto directory = directoryOf(r, collection);
    if (!directory || !(privilegesOn(r, *c, *place) & kRead)) return std::nullopt;
    return Asked{r, *c, std::move(*place), *directory};
}

// A member comes into sight or leaves it without a change of its own where a list says otherwise than the place above
// it: tokens are good as long as these places are the same.
uint64_t scopeOf(const Asked& a) {
    std::string text = a.place.owner + "/" + a.place.tree();
    const OwnersLists* lists = listsOf(a.r, a.c, a.place.owner);
    if (lists && a.r->user != a.place.owner)
        for (const std::string& tree : lists->trees()) {
            const auto at = TreePath::of("", "/" + a.place.owner + "/" + tree);
            if (!at || at->levels() <= a.place.levels() || !at->isWithin(a.place)) continue;
            const bool readable = privilegesOn(a.r, a.c, *at) & kRead;
            if (readable != bool(privilegesOn(a.r, a.c, at->parent()) & kRead))
                text += "\n" + tree + (readable ? " +" : " -");
        }
    return textHash(text);
}

bool shows(const Asked& a, const std::vector<std::string>& below) {
    const TreePath place{a.place.owner, below};
    return !place.isReserved() && (privilegesOn(a.r, a.c, place) & kRead);
}

TreeJournal::Answer look(const Asked& a, bool isDeep, const std::optional<SyncToken>& from, bool wantsChanges,
                         uint64_t limit) {
    timespec now{};
    clock_gettime(CLOCK_REALTIME, &now);
    TreeJournal::Question q;
    q.path = a.directory;
    q.below = a.place.below;
    q.isDeep = isDeep;
    q.scope = scopeOf(a);
    q.shows = [&a](const std::vector<std::string>& below) { return shows(a, below); };
    q.from = from;
    q.wantsChanges = wantsChanges;
    q.limit = limit;
    q.now = int64_t{now.tv_sec} * 1000000000 + now.tv_nsec;
    auto answer = TreeJournal(ListStore(a.c.lists).pathFor(a.place.owner, ".sync")).changes(q);
    if (answer.outcome == TreeJournal::Outcome::unreadable || answer.outcome == TreeJournal::Outcome::unwritable)
        ap_log_rerror(APLOG_MARK, APLOG_ERR, answer.error, a.r, "davacl: the changes of %s cannot be %s (%s)", a.r->uri,
                      answer.outcome == TreeJournal::Outcome::unreadable ? "read" : "noted",
                      ListStore(a.c.lists).pathFor(a.place.owner, ".sync").c_str());
    return answer;
}

dav_error* refusal(request_rec* r, int status, const char* precondition, const char* words) {
    return precondition ? dav_new_error_tag(r->pool, status, 0, 0, words, "DAV:", precondition)
                        : dav_new_error(r->pool, status, 0, 0, words);
}

dav_error* errorOf(request_rec* r, TreeJournal::Outcome outcome) {
    switch (outcome) {
    case TreeJournal::Outcome::told: return nullptr;
    case TreeJournal::Outcome::invalidToken:
        return refusal(r, HTTP_FORBIDDEN, "valid-sync-token",
                       "The token is not of this collection, or too old. Send an empty one.");
    case TreeJournal::Outcome::linked:
        return refusal(r, HTTP_FORBIDDEN, "sync-traversal-supported",
                       "A collection below is a symbolic link on the server. Synchronize each by itself.");
    default: return refusal(r, HTTP_SERVICE_UNAVAILABLE, nullptr, "The server cannot note what has changed.");
    }
}

std::string bareResponse(const std::string& href, const char* status, const char* error = "") {
    return "<D:response>" + href + "<D:status>HTTP/1.1 " + status + "</D:status>" + error + "</D:response>\n";
}

std::string responseOf(const Asked& a, const TreeJournal::Change& change,
                       const std::function<std::string(const dav_resource*)>& respond) {
    std::string path = a.c.base + ("/" + a.place.owner) + "/";
    if (!a.place.below.empty()) path += a.place.tree() + "/";
    path += change.path;
    if (!change.isGone) {
        const char* url = ap_os_escape_path(a.r->pool, path.c_str(), 1);
        request_rec* found = ap_sub_req_lookup_uri(url, a.r, nullptr);
        dav_resource* member = nullptr;
        std::string text;
        const bool isThere = found->status == HTTP_OK && !dav_get_resource(found, 0, 0, &member) && member->exists;
        if (isThere) text = respond(member);
        const bool isHidden = found->status != HTTP_OK && found->status != HTTP_NOT_FOUND;
        ap_destroy_sub_req(found);
        if (isThere || isHidden) return text;
    }
    return bareResponse(hrefElement(a.r, path), "404 Not Found");
}

} // namespace

bool canSynchronize(request_rec* r, const dav_resource* collection) {
    return askedOf(r, collection).has_value();
}

std::optional<std::string> syncTokenOf(request_rec* r, const dav_resource* collection) {
    const auto bare = [](std::string_view path) { return path.substr(0, path.find_last_not_of('/') + 1); };
    if (r->main || !collection->uri || bare(r->uri) != bare(collection->uri)) return std::nullopt;
    const auto asked = askedOf(r, collection);
    if (!asked) return std::nullopt;
    const auto answer = look(*asked, true, std::nullopt, false, 0);
    return answer.outcome == TreeJournal::Outcome::told ? std::optional(answer.token.text()) : std::nullopt;
}

SyncAnswer synchronize(request_rec* r, const dav_resource* collection, const apr_xml_doc* doc,
                       const std::function<std::string(const dav_resource*)>& respond) {
    const char* problem = nullptr;
    const auto request = parseSyncRequest(doc->root, problem);
    if (!request) return {{}, refusal(r, HTTP_BAD_REQUEST, nullptr, problem)};
    if (!child(doc->root, "prop"))
        return {{}, refusal(r, HTTP_BAD_REQUEST, nullptr, "A sync-collection has a DAV:prop.")};
    const auto asked = askedOf(r, collection);
    if (!asked) return {{}, refusal(r, HTTP_FORBIDDEN, "supported-report", "Of this there is no sync-collection.")};
    std::optional<SyncToken> from;
    if (!request->token.empty() && !(from = SyncToken::parse(request->token)))
        return {{}, errorOf(r, TreeJournal::Outcome::invalidToken)};
    auto answer =
        look(*asked, request->isDeep, from, true, std::min(request->limit.value_or(kMostResponses), kMostResponses));
    if (answer.outcome != TreeJournal::Outcome::told) return {{}, errorOf(r, answer.outcome)};
    SyncAnswer out;
    for (const auto& change : answer.changes) {
        out.text += responseOf(*asked, change, respond);
        if (out.text.size() <= kMostBytes) continue;
        return {{},
                refusal(r, HTTP_FORBIDDEN, "number-of-matches-within-limits",
                        "The report would be too long. Ask for fewer results at once.")};
    }
    if (answer.token.cut)
        out.text += bareResponse(hrefOf(r, asked->c, asked->place), "507 Insufficient Storage",
                                 "<D:error><D:number-of-matches-within-limits/></D:error>");
    out.text += "<D:sync-token>" + answer.token.text() + "</D:sync-token>\n";
    return out;
}

} // namespace rolvane::davacl
