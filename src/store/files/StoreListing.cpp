#include "store/files/StoreListing.h"

#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "store/dav/Collections.h"
#include "store/files/StoreFiles.h"
#include "store/files/SyncedListing.h"

#include <algorithm>
#include <deque>
#include <set>

namespace rolvane {

namespace {

constexpr size_t kListingBytes = 256u << 20;
constexpr size_t kListingEntries = 500000;

// A listing under way: its body is parsed as it arrives and kept only when it is whole.
struct Staged {
    MultistatusReader reader{MultistatusLimits{32, kListingEntries, 16384}};
    bool sound = true;
};

std::optional<Date> serverDateOf(const HttpResponse& answer) {
    const std::string* date = answer.header("date");
    return date ? Date::fromHTTP(*date) : std::nullopt;
}

// True when the name lies directly inside the container.
bool isMember(const Url& name, const Url& container) {
    return name.cxURLByDeletingLastComponent().absoluteString() == container.absoluteString();
}

std::string pathOf(const Url& name) {
    return name.path();
}

bool isBaseLocation(const Url& name) {
    return name.pathComponents().size() == 3;
} // "/", user, "Contacts"

} // namespace

// The answers are handed over as they came, and judged on the thread that reads them.
struct StoreListing::Asked {
    std::vector<Url> containers;
    std::vector<std::shared_ptr<Staged>> staged;
    std::vector<HttpResponse> answers; // each written once, before its number stands among the arrived ones
    Mutex mutex;
    Condition changed;
    std::deque<size_t> arrived GUARDED_BY(mutex);
    bool isOfChanges = false; // one answer, to the question what has changed
    bool isOfToken = false;   // one answer, to the question for the token
    bool isTakenIn = false;   // that answer is in the memory
    std::optional<Date> serverDate;

    void arrive(size_t number, HttpResponse answer) {
        const Lock guard(mutex);
        answers[number] = std::move(answer);
        arrived.push_back(number);
        changed.notify_all();
    }
    // Waits for another answer. As often as there are containers.
    size_t next() {
        Lock lock(mutex);
        changed.wait(lock, [&]() REQUIRES(mutex) { return !arrived.empty(); });
        const size_t number = arrived.front();
        arrived.pop_front();
        return number;
    }
};

StoreListing::AskedRef StoreListing::ask(const std::vector<Url>& containers, const Url* tagged) {
    auto asked = std::make_shared<Asked>();
    std::vector<HttpRequest> requests;
    for (const Url& name : containers) {
        const auto url = _session.collectionEndpoint(name);
        if (!url) return asked; // of none of them then
        HttpRequest r = StoreSession::propfind(*url, 1, tagged && *tagged == name);
        r.limits = {300, 60, kListingBytes, 64u << 10};
        auto reading = std::make_shared<Staged>();
        r.sink = [reading](std::string_view bytes) { return reading->sound = reading->reader.feed(bytes); };
        asked->staged.push_back(reading);
        requests.push_back(std::move(r));
    }
    asked->containers = containers;
    asked->answers.resize(requests.size());
    for (size_t i = 0; i < requests.size(); ++i)
        _session.start(std::move(requests[i]),
                       [asked, i](HttpResponse answer) { asked->arrive(i, std::move(answer)); });
    return asked;
}

StoreListing::Members StoreListing::read(Asked& asked, size_t number) {
    Members out;
    const Url place = *_session.collectionEndpoint(asked.containers[number]);
    const HttpResponse answer =
        _session.judged(StoreSession::request("PROPFIND", place), std::move(asked.answers[number]),
                        [](int status) { return status == 404; });
    const auto staged = std::move(asked.staged[number]);
    out.code = answer.status;
    out.serverDate = serverDateOf(answer);
    // What came under another status is here; a body of 207 has been read.
    if (answer.status != 207 || !staged->sound || !staged->reader.feed(answer.body)) return out;
    const auto entries = staged->reader.finish();
    if (!entries) return out;
    const Url container = *_session.nameFor(place.absoluteString());
    std::vector<std::pair<Url, MultistatusEntry>> inside;
    bool isNamed = false, isCollection = false, whole = true;
    for (const MultistatusEntry& entry : *entries) {
        const auto name = _session.nameFor(StoreSession::pathOfHref(entry.href));
        if (name && *name == container) {
            isNamed = true;
            isCollection = entry.isCollection;
            continue;
        }
        if (!name || !isMember(*name, container)) {
            CXLog("An entry with a strange name in the listing of %@ is left out.", container);
            continue;
        }
        if (entry.status == 404) continue; // removed while the listing was made
        if (entry.status != 0 && entry.status != 200) whole = false;
        inside.emplace_back(*name, entry);
    }
    if (!isNamed) isCollection = !inside.empty() || isEmptyCollection(place);
    if (isCollection && whole) out.entries = std::move(inside);
    return out;
}

// Of a listing that holds nothing, not even the container itself, as some servers give it: an answer that lost its
// content looks the same.
bool StoreListing::isEmptyCollection(const Url& place) {
    const HttpResponse answer =
        _session.send(StoreSession::propfind(place, 0), [](int status) { return status == 404; });
    MultistatusReader reader;
    const auto entries = answer.status == 207 && reader.feed(answer.body) ? reader.finish() : std::nullopt;
    return entries && entries->size() == 1 && entries->front().isCollection;
}

std::vector<StoreListing::Members> StoreListing::readAll(Asked& asked) {
    std::vector<Members> out(asked.containers.size());
    for (size_t i = 0; i < out.size(); ++i) {
        const size_t number = asked.next();
        out[number] = read(asked, number);
    }
    return out;
}

std::vector<StoreListing::Members> StoreListing::members(const std::vector<Url>& containers) {
    std::vector<Members> out = readAll(*ask(containers));
    out.resize(containers.size());
    return out;
}

void StoreListing::stamp(std::string_view name, const MultistatusEntry& entry, const std::optional<Date>& serverDate,
                         FileInfo& info) {
    info.size = entry.length.value_or(0);
    info.etag = entry.etag;
    info.modificationdate = info.stored = entry.lastModified;
    info.seen = _versions.knows(name, {entry.etag, entry.lastModified, info.size});
    // A version without a date is told by its tag alone: known, it is older than every sync, else later.
    if (!entry.lastModified) info.modificationdate = info.seen ? Date::distantPast() : Date::distantFuture();
    // Only with both dates is it known what "now" is to the server; its files may be dated ahead of its clock.
    if (!info.seen && entry.lastModified && serverDate)
        info.modificationdate = std::max(*entry.lastModified, *serverDate).addingSeconds(kUnseenSeconds);
}

bool StoreListing::addEntries(const Members& members, FileListing& out, std::vector<Url>& groupCollections) {
    if (!members.entries) return false;
    for (const auto& [name, entry] : *members.entries) {
        FileInfo info;
        info.displayName = name.cxLastComponent();
        info.isCollection = entry.isCollection;
        if (StoreFiles::isReservedName(info.displayName)) continue;
        if (!entry.isCollection)
            stamp(name.absoluteString(), entry, members.serverDate, info);
        else if (info.displayName.ends_with("CXGroup"))
            groupCollections.push_back(name);
        else
            info.modificationdate = entry.lastModified;
        out[pathOf(name)] = std::move(info);
    }
    return true;
}

// A group that is a collection has the version of the state inside it; without one it has no date.
bool StoreListing::addStates(const std::vector<Url>& groups, bool synced, FileListing& out) {
    std::vector<HttpRequest> requests;
    for (const Url& group : groups)
        requests.push_back(
            StoreSession::propfind(_session.endpoint(group)->cxURLByAppendingComponent(CXDAVManager::kStateName), 0));
    const auto answers = _session.sendAll(std::move(requests), [](int status) { return status == 404; });
    for (size_t i = 0; i < answers.size(); ++i) {
        if (answers[i].status == 404) {
            if (synced) _listings.keep(groups[i], ListingMemory::kSynced, {});
            continue;
        }
        MultistatusReader reader;
        if (answers[i].status != 207 || !reader.feed(answers[i].body)) return false;
        const auto entries = reader.finish();
        if (!entries || entries->size() != 1) return false;
        if (synced)
            _listings.keep(groups[i], ListingMemory::kSynced,
                           {{groups[i].cxURLByAppendingComponent(CXDAVManager::kStateName), entries->front()}});
        stamp(groups[i].absoluteString(), entries->front(), serverDateOf(answers[i]), out[pathOf(groups[i])]);
    }
    return true;
}

// The tags are told before the buckets are listed: what changes in between is in the listing already, and listed again
// the next time.
bool StoreListing::addBuckets(const Members& people, Keeping keeping, FileListing& out,
                              const CXFileManager::ListingPart& part) {
    if (!people.entries) return false;
    std::vector<Url> none, names;
    std::vector<std::string> tags;
    for (const auto& [name, entry] : *people.entries) {
        if (!entry.isCollection || StoreFiles::isReservedName(name.cxLastComponent())) continue;
        const std::string tag = keeping == Keeping::synced   ? ListingMemory::kSynced
                                : keeping == Keeping::tagged ? entry.membersTag
                                                             : std::string();
        if (addUnchanged(name, tag, people.serverDate, out)) continue;
        names.push_back(name);
        tags.push_back(tag);
    }
    const AskedRef asked = ask(names);
    bool whole = asked->containers.size() == names.size();
    for (size_t i = 0; i < asked->containers.size(); ++i) {
        const size_t number = asked->next();
        const Members bucket = read(*asked, number);
        FileListing inside;
        whole = addEntries(bucket, inside, none) && whole;
        if (!bucket.entries) continue;
        _listings.keep(names[number], tags[number], *bucket.entries);
        if (whole && part) part(inside);
        out.merge(inside);
    }
    return whole;
}

bool StoreListing::addUnchanged(const Url& container, const std::string& tag, const std::optional<Date>& serverDate,
                                FileListing& out) {
    const std::string path = pathOf(container) + "/";
    std::string url = container.absoluteString() + "/";
    const size_t start = url.size();
    return _listings.forEach(container, tag, [&](const ListingMemory::Member& member) {
        FileInfo info;
        info.displayName = Url::percentDecode(member.encodedName);
        if (StoreFiles::isReservedName(info.displayName)) return;
        info.isCollection = member.entry.isCollection;
        url.resize(start);
        url += member.encodedName;
        if (info.isCollection)
            info.modificationdate = member.entry.lastModified;
        else
            stamp(url, member.entry, serverDate, info);
        out.insert_or_assign(path + info.displayName, std::move(info));
    });
}

StoreListing::AskedRef StoreListing::begin(const Url& container) {
    if (isBaseLocation(container) && (_session.maySynchronize() || !_session.hasAnswered()))
        return _listings.token(container).empty() ? askForToken(container) : askForChanges(container);
    return askForAll(container, _session.mayGiveMembersTags());
}

StoreListing::AskedRef StoreListing::askForAll(const Url& container, bool tagged) {
    std::vector<Url> asked{container};
    const Url people = container.cxURLByAppendingComponent("People");
    if (isBaseLocation(container)) asked.push_back(people); // nearly always there, and a way to the store saved
    return ask(asked, tagged ? &people : nullptr);
}

StoreListing::AskedRef StoreListing::askForToken(const Url& tree) {
    auto question = SyncedListing(_session, _listings).tokenQuestion(tree);
    if (!question) return nullptr;
    auto asked = std::make_shared<Asked>();
    asked->isOfToken = true;
    asked->answers.resize(1);
    _session.start(std::move(*question), [asked](HttpResponse answer) { asked->arrive(0, std::move(answer)); });
    return asked;
}

// It tells changes during a listing that follows once more.
std::string StoreListing::tokenOf(const Url& tree, const AskedRef& begun) {
    SyncedListing synced(_session, _listings);
    if (!begun || !begun->isOfToken) return synced.tokenOf(tree);
    HttpResponse answer = std::move(begun->answers[begun->next()]);
    return SyncedListing::tokenIn(
        _session.judged(*synced.tokenQuestion(tree), std::move(answer), [](int) { return true; }));
}

StoreListing::AskedRef StoreListing::askForChanges(const Url& tree) {
    auto asked = std::make_shared<Asked>();
    asked->isOfChanges = true;
    asked->answers.resize(1);
    _session.start(SyncedListing(_session, _listings).question(tree),
                   [asked](HttpResponse answer) { asked->arrive(0, std::move(answer)); });
    return asked;
}

bool StoreListing::bringUpToDate(const Url& tree, AskedRef& begun) {
    if (!isBaseLocation(tree) || !_session.maySynchronize() || _listings.token(tree).empty()) return false;
    if (begun && begun->isTakenIn) return true;
    SyncedListing synced(_session, _listings);
    if (!begun || !begun->isOfChanges) begun = askForChanges(tree);
    HttpResponse answer = std::move(begun->answers[begun->next()]);
    begun->serverDate = serverDateOf(answer);
    answer = _session.judged(synced.question(tree), std::move(answer), [](int) { return true; });
    begun->isTakenIn = synced.bringUpToDate(tree, std::move(answer));
    if (begun->isTakenIn) return true;
    begun.reset();
    return false;
}

std::optional<FileListing> StoreListing::contactsChangedSince(const Url& tree, const AskedRef& begun,
                                                              const Since& since) {
    const auto files = _listings.filesChangedSince(tree, since.listing);
    const auto known = _versions.changedSince(since.versions);
    if (!files || !known) return std::nullopt;
    std::set<std::string> names(files->begin(), files->end());
    for (const std::string& url : *known)
        if (url.starts_with(tree.absoluteString() + "/")) names.insert(url);
    for (const Url& other : since.others) names.insert(other.absoluteString());
    FileListing out;
    const Url people = tree.cxURLByAppendingComponent("People");
    for (const std::string& name : names) {
        const Url url(name);
        const Url bucket = url.cxURLByDeletingLastComponent();
        if (!isMember(bucket, people)) return std::nullopt;
        const auto entry =
            _listings.member(bucket, ListingMemory::kSynced, std::string_view(name).substr(name.rfind('/') + 1));
        if (!entry || entry->isCollection) return std::nullopt;
        FileInfo info;
        info.displayName = url.cxLastComponent();
        stamp(name, *entry, begun ? begun->serverDate : std::nullopt, info);
        out[pathOf(url)] = std::move(info);
    }
    return out;
}

// The tree as the memory has it, once that is up to date.
std::optional<FileListing> StoreListing::listChanged(const Url& tree, AskedRef begun) {
    if (!bringUpToDate(tree, begun)) return std::nullopt;
    const auto serverDate = begun->serverDate;
    const Url people = tree.cxURLByAppendingComponent("People");
    Members top{207, _listings.entries(tree, ListingMemory::kSynced), serverDate};
    FileListing out;
    std::vector<Url> groups;
    bool whole = addEntries(top, out, groups);
    const auto found = out.find(pathOf(people));
    if (whole && found != out.end() && found->second.isCollection) {
        const auto buckets = _listings.entries(people, ListingMemory::kSynced);
        whole = buckets.has_value();
        if (whole)
            for (const auto& [name, entry] : *buckets)
                if (entry.isCollection && !StoreFiles::isReservedName(name.cxLastComponent()))
                    whole = addUnchanged(name, ListingMemory::kSynced, serverDate, out) && whole;
    }
    for (const Url& group : groups) {
        const bool known = _listings.forEach(group, ListingMemory::kSynced, [&](const ListingMemory::Member& state) {
            if (!state.entry.isCollection && state.encodedName == CXDAVManager::kStateName)
                stamp(group.absoluteString(), state.entry, serverDate, out[pathOf(group)]);
        });
        whole = whole && known;
    }
    if (whole) return out;
    _listings.forgetBelow(tree);
    return std::nullopt;
}

std::optional<FileListing> StoreListing::list(const Url& container, const AskedRef& begun,
                                              const CXFileManager::ListingPart& part) {
    std::string token;
    if (isBaseLocation(container) && _session.maySynchronize()) {
        if (!_listings.token(container).empty())
            if (auto out = listChanged(container, begun)) return out;
        token = tokenOf(container, begun);
        if (!token.empty()) _listings.forgetBelow(container);
    }
    const auto answers = readAll(begun && !begun->isOfChanges && !begun->isOfToken && token.empty()
                                     ? *begun
                                     : *askForAll(container, token.empty() && _session.mayGiveMembersTags()));
    FileListing out;
    std::vector<Url> groups;
    const Url people = container.cxURLByAppendingComponent("People");
    const bool synced = !token.empty();
    if (answers.empty() || !addEntries(answers.front(), out, groups)) return std::nullopt;
    const auto found = out.find(pathOf(people));
    const bool holdsPeople = answers.size() == 2 && found != out.end() && found->second.isCollection;
    const Keeping keeping = synced ? Keeping::synced : _session.givesMembersTags() ? Keeping::tagged : Keeping::nothing;
    if (holdsPeople && !addBuckets(answers.back(), keeping, out, part)) return std::nullopt;
    if (!addStates(groups, synced, out)) return std::nullopt;
    if (synced) {
        _listings.keep(container, ListingMemory::kSynced, *answers.front().entries);
        if (holdsPeople) _listings.keep(people, ListingMemory::kSynced, *answers.back().entries);
        _listings.keepToken(container, token);
    }
    return out;
}

} // namespace rolvane
