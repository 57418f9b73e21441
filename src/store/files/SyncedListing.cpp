#include "store/files/SyncedListing.h"

#include "foundation/Log.h"
#include "store/dav/CXDAVManager.h"

#include <algorithm>
#include <map>
#include <memory>
#include <utility>

namespace rolvane {
namespace {

constexpr size_t kAnswerBytes = 64u << 20;
constexpr int kMostPages = 10000;
constexpr int kInsufficientStorage = 507;
constexpr std::string_view kClockFile = "dateFile"; // which its owner touches with each pass

bool isAny(int) {
    return true;
}

std::string quoted(const std::string& text) {
    std::string out;
    for (const char c : text) {
        if (c == '<')
            out += "&lt;";
        else if (c == '&')
            out += "&amp;";
        else
            out += c;
    }
    return out;
}

// The listing of a tree needs the tree, "People" and the buckets, and each group's state.
bool isListed(const std::vector<std::string>& below) {
    const bool inPeople = below.front() == "People";
    return below.size() == 1 || (inPeople && below.size() <= 3) ||
           (below.size() == 2 && below.front().ends_with("CXGroup") && below.back() == CXDAVManager::kStateName);
}

bool holdsListed(const std::vector<std::string>& below) {
    return below.size() == 1 ? below.front() == "People" || below.front().ends_with("CXGroup")
                             : below.size() == 2 && below.front() == "People";
}

std::vector<std::string> segmentsBelow(const Url& tree, const Url& name) {
    const auto whole = name.pathComponents(), above = tree.pathComponents();
    if (whole.size() <= above.size() || !std::equal(above.begin(), above.end(), whole.begin())) return {};
    return {whole.begin() + static_cast<std::ptrdiff_t>(above.size()), whole.end()};
}

// A store may tell once more what was told before. Of a collection, what is in it is told by itself.
bool isSameVersion(const MultistatusEntry& a, const MultistatusEntry& b) {
    if (a.isCollection || b.isCollection) return a.isCollection == b.isCollection;
    return a.etag == b.etag && a.lastModified == b.lastModified && a.length == b.length;
}

struct Edits {
    ListingMemory::Edits members;
    Url container;
};

bool isBucket(const std::vector<std::string>& below) {
    return below.size() == 2 && below.front() == "People";
}

} // namespace

std::string SyncedListing::tokenOf(const Url& tree) {
    auto question = tokenQuestion(tree);
    return question ? tokenIn(_session.send(std::move(*question), isAny)) : std::string();
}

std::optional<HttpRequest> SyncedListing::tokenQuestion(const Url& tree) const {
    const auto place = _session.collectionEndpoint(tree);
    if (!place) return std::nullopt;
    HttpRequest r = StoreSession::propfind(*place, 0);
    r.body = std::make_shared<const std::string>("<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<propfind "
                                                 "xmlns=\"DAV:\"><prop><sync-token/></prop></propfind>");
    return r;
}

std::string SyncedListing::tokenIn(const HttpResponse& answer) {
    MultistatusReader reader;
    if (!answer.complete() || answer.status != 207 || !reader.feed(answer.body)) return {};
    const auto entries = reader.finish();
    return entries && entries->size() == 1 ? entries->front().syncToken : std::string();
}

HttpRequest SyncedListing::question(const Url& tree) const {
    HttpRequest r = StoreSession::request("REPORT", *_session.collectionEndpoint(tree));
    r.headers = {{"Depth", "0"}, {"Content-Type", "application/xml; charset=utf-8"}};
    r.body = std::make_shared<const std::string>(
        "<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<sync-collection xmlns=\"DAV:\"><sync-token>" +
        quoted(_memory.token(tree)) +
        "</sync-token><sync-level>infinite</sync-level><prop><resourcetype/><getlastmodified/><getcontentlength/>"
        "<getetag/></prop></sync-collection>");
    r.limits = {300, 60, kAnswerBytes, 64u << 10};
    return r;
}

bool SyncedListing::bringUpToDate(const Url& tree, HttpResponse first) {
    HttpResponse answer = std::move(first);
    for (int page = 0; page < kMostPages; ++page) {
        bool isCut = false;
        if (!take(tree, answer, isCut)) break;
        if (!isCut) return true;
        answer = _session.send(question(tree), isAny);
    }
    _memory.forgetBelow(tree);
    return false;
}

bool SyncedListing::take(const Url& tree, const HttpResponse& answer, bool& isCut) {
    if (!answer.complete()) return false;
    if (answer.status == 400 || answer.status == 405 || answer.status == 501) _session.doesNotSynchronize();
    MultistatusReader reader;
    if (answer.status != 207 || !reader.feed(answer.body)) return false;
    const auto changes = reader.finish();
    const auto applied = changes && !reader.syncToken().empty() ? apply(tree, *changes) : std::nullopt;
    if (!applied) return false;
    isCut = applied->isCut;
    if (isCut && reader.syncToken() == _memory.token(tree)) return false; // it would never end
    _memory.keepToken(tree, reader.syncToken(), applied->files);
    if (!applied->files || !applied->files->empty()) _memory.noteChanges(changes->size());
    return true;
}

// An answer tells of a member before or after the collection that it has come in.
std::optional<SyncedListing::Applied> SyncedListing::apply(const Url& tree,
                                                           const std::vector<MultistatusEntry>& changes) {
    Applied out;
    std::map<std::string, Edits> edits; // by container
    std::vector<Url> departed, collections;
    for (const MultistatusEntry& change : changes) {
        const auto name = _session.nameFor(StoreSession::pathOfHref(change.href));
        if (name && *name == tree) {
            out.isCut = out.isCut || change.status == kInsufficientStorage;
            if (change.status == 0 || change.status == 200 || change.status == kInsufficientStorage) continue;
            return std::nullopt;
        }
        const auto below = name ? segmentsBelow(tree, *name) : std::vector<std::string>();
        if (below.empty()) { // as in a listing
            CXLog("An entry with a strange name in the listing of %@ is left out.", tree);
            continue;
        }
        const bool isGone = change.status == 404;
        if (!isGone && change.status != 0 && change.status != 200) return std::nullopt;
        if (isGone || !change.isCollection) departed.push_back(*name);
        if (!isGone && change.isCollection && holdsListed(below)) collections.push_back(*name);
        if (!isListed(below)) continue;
        const Url container = name->cxURLByDeletingLastComponent();
        Edits& inside = edits.try_emplace(container.absoluteString(), Edits{{}, container}).first->second;
        const std::string& whole = name->absoluteString();
        inside.members[whole.substr(whole.rfind('/') + 1)] = isGone ? std::nullopt : std::optional(change);
    }
    for (const Url& name : departed)
        if (holdsListed(segmentsBelow(tree, name))) _memory.forgetBelow(name);
    for (const Url& name : collections)
        if (!_memory.has(name, ListingMemory::kSynced)) {
            _memory.keep(name, ListingMemory::kSynced, {});
            out.files.reset();
        }
    for (auto& [place, edit] : edits) {
        // One that is not known has departed, or is told on a later page than what is in it.
        const auto isThere = [](const auto& member) { return member.second.has_value(); };
        if (!_memory.has(edit.container, ListingMemory::kSynced)) {
            if (std::none_of(edit.members.begin(), edit.members.end(), isThere)) continue;
            _memory.keep(edit.container, ListingMemory::kSynced, {});
        }
        const bool isInBucket = isBucket(segmentsBelow(tree, edit.container));
        _memory.edit(edit.container, ListingMemory::kSynced, edit.members,
                     [&, &place = place, &edit = edit](const std::string& name, const auto& before, const auto& now) {
                         if (!before && !now) return;
                         if (before && now && isSameVersion(*before, *now)) return;
                         if (before && now && edit.container == tree && name == kClockFile) return;
                         const bool isFile = before && now && !before->isCollection && !now->isCollection;
                         if (!isFile || !isInBucket)
                             out.files.reset();
                         else if (out.files)
                             out.files->push_back(place + "/" + name);
                     });
    }
    return _memory.has(tree, ListingMemory::kSynced) ? std::optional(out) : std::nullopt;
}

} // namespace rolvane
