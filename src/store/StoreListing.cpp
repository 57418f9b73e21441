#include "store/StoreListing.h"

#include "foundation/Log.h"
#include "store/StoreFiles.h"

#include <algorithm>

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

std::string asDirectory(const Url& url) {
    const std::string& text = url.absoluteString();
    return text.ends_with('/') ? text : text + "/";
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

std::vector<StoreListing::Members> StoreListing::members(const std::vector<Url>& containers, const Url* tagged) {
    std::vector<std::shared_ptr<Staged>> staged;
    std::vector<HttpRequest> requests;
    std::vector<Members> out(containers.size());
    for (const Url& name : containers) {
        const auto url = _session.endpoint(name);
        if (!url) return out;
        HttpRequest r = StoreSession::propfind(Url(asDirectory(*url)), 1, tagged && *tagged == name);
        r.limits = {300, 60, kListingBytes, 64u << 10};
        auto reading = std::make_shared<Staged>();
        r.sink = [reading](std::string_view bytes) { return reading->sound = reading->reader.feed(bytes); };
        staged.push_back(reading);
        requests.push_back(std::move(r));
    }
    const auto answers = _session.sendAll(std::move(requests));
    for (size_t i = 0; i < answers.size(); ++i) {
        out[i].code = answers[i].status;
        out[i].serverDate = serverDateOf(answers[i]);
        if (answers[i].status != 207 || !staged[i]->sound) continue;
        const auto entries = staged[i]->reader.finish();
        if (!entries || entries->empty()) continue; // even an empty container names itself
        const Url container = *_session.nameFor(_session.endpoint(containers[i])->absoluteString());
        std::vector<std::pair<Url, MultistatusEntry>> inside;
        bool namesItself = false, whole = true;
        for (const MultistatusEntry& entry : *entries) {
            const auto name = _session.nameFor(entry.href);
            if (name && *name == container) {
                namesItself = entry.isCollection;
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
        if (namesItself && whole) out[i].entries = std::move(inside);
    }
    return out;
}

void StoreListing::stamp(std::string_view name, const MultistatusEntry& entry, const std::optional<Date>& serverDate,
                         FileInfo& info) {
    info.size = entry.length.value_or(0);
    info.etag = entry.etag;
    info.modificationdate = info.stored = entry.lastModified;
    info.seen = _versions.knows(name, {entry.etag, entry.lastModified, info.size});
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
bool StoreListing::addStates(const std::vector<Url>& groups, FileListing& out) {
    std::vector<HttpRequest> requests;
    for (const Url& group : groups)
        requests.push_back(
            StoreSession::propfind(_session.endpoint(group)->cxURLByAppendingComponent(CXDAVManager::kStateName), 0));
    const auto answers = _session.sendAll(std::move(requests));
    for (size_t i = 0; i < answers.size(); ++i) {
        if (answers[i].status == 404) continue;
        MultistatusReader reader;
        if (answers[i].status != 207 || !reader.feed(answers[i].body)) return false;
        const auto entries = reader.finish();
        if (!entries || entries->size() != 1) return false;
        stamp(groups[i].absoluteString(), entries->front(), serverDateOf(answers[i]), out[pathOf(groups[i])]);
    }
    return true;
}

// The tags are told before the buckets are listed: what changes in between is in the listing already, and listed again
// the next time.
bool StoreListing::addBuckets(const Members& people, bool tagged, FileListing& out) {
    if (!people.entries) return false;
    std::vector<Url> none, names;
    std::vector<std::string> tags;
    for (const auto& [name, entry] : *people.entries) {
        if (!entry.isCollection || StoreFiles::isReservedName(name.cxLastComponent())) continue;
        const std::string tag = tagged ? entry.membersTag : std::string();
        if (addUnchanged(name, tag, people.serverDate, out)) continue;
        names.push_back(name);
        tags.push_back(tag);
    }
    const auto buckets = members(names);
    for (size_t i = 0; i < names.size(); ++i) {
        if (!addEntries(buckets[i], out, none)) return false;
        _listings.keep(names[i], tags[i], *buckets[i].entries);
    }
    return true;
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

std::optional<FileListing> StoreListing::list(const Url& container) {
    FileListing out;
    std::vector<Url> groups, asked{container};
    const Url people = container.cxURLByAppendingComponent("People");
    if (isBaseLocation(container)) asked.push_back(people); // nearly always there, and a way to the store saved
    const bool tagged = _session.givesMembersTags();
    const auto answers = members(asked, tagged ? &people : nullptr);
    if (!addEntries(answers.front(), out, groups)) return std::nullopt;
    const auto found = out.find(pathOf(people));
    const bool holdsPeople = asked.size() == 2 && found != out.end() && found->second.isCollection;
    if (holdsPeople && !addBuckets(answers.back(), tagged, out)) return std::nullopt;
    return addStates(groups, out) ? std::optional(std::move(out)) : std::nullopt;
}

} // namespace rolvane
