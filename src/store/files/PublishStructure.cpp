#include "store/files/PublishStructure.h"

#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "foundation/Paths.h"
#include "foundation/PropertyList.h"
#include "store/dav/Collections.h"
#include "store/files/StoreListing.h"

#include <algorithm>
#include <set>

namespace rolvane {

namespace {

constexpr int kBuckets = 32;

std::set<std::string> collectionsIn(const StoreListing::Members& members) {
    std::set<std::string> out;
    for (const auto& [name, entry] : *members.entries)
        if (entry.isCollection) out.insert(name.cxLastComponent());
    return out;
}

bool hasFile(const StoreListing::Members& members, std::string_view wanted) {
    for (const auto& [name, entry] : *members.entries)
        if (!entry.isCollection && name.cxLastComponent() == wanted) return true;
    return false;
}

std::vector<int> allBuckets() {
    std::vector<int> out(kBuckets);
    for (int i = 0; i < kBuckets; ++i) out[static_cast<size_t>(i)] = i;
    return out;
}

} // namespace

// `everything`: the buckets are listed too, at the same time.
PublishStructure::Missing PublishStructure::look(bool everything) {
    VersionMemory unused;
    ListingMemory none;
    StoreListing listing(_session, unused, none);
    std::vector<Url> wanted{base()};
    if (everything) wanted.push_back(base().cxURLByAppendingComponent("People"));
    const auto found = listing.members(wanted);
    Missing m;
    if (found[0].code == 404) return {true, true, true, true, true, allBuckets()};
    if (!found[0].entries) return m;
    m.known = true;
    m.people = !collectionsIn(found[0]).contains("People");
    m.info = !hasFile(found[0], "info");
    m.dateFile = !hasFile(found[0], "dateFile");
    if (m.people) {
        m.buckets = allBuckets();
    } else if (everything) {
        if (!found[1].entries) return {};
        const auto present = collectionsIn(found[1]);
        for (const int bucket : allBuckets())
            if (!present.contains(std::to_string(bucket))) m.buckets.push_back(bucket);
    }
    return m;
}

bool PublishStructure::check(bool create) {
    Lock guard(_mutex);
    return _isKnown = checkNow(create);
}

bool PublishStructure::checkNow(bool create) {
    Missing missing = look(_doubtful);
    if (!missing.known) return false;
    if (!missing.anything()) {
        _doubtful = false;
        return true;
    }
    _doubtful = true;
    if (!create) return false;
    // Something is missing: it may be more than the first look showed.
    if (!missing.tree && !missing.people) missing = look(true);
    if (!missing.known) return false;
    if (_mendOnly && missing.info && missing.people) return false;
    if (!complete(missing)) {
        // Perhaps because somebody else is making it, too: servers answer variously to one of two at the same time.
        const Missing left = look(true);
        if (!left.known || left == missing || (left.anything() && !complete(left))) return false;
    }
    _doubtful = false;
    return true;
}

bool PublishStructure::repair() {
    _doubtful = true;
    return check(true);
}

void PublishStructure::keepSerialNumber(std::string serial) {
    Lock guard(_mutex);
    _serial = std::move(serial);
}

bool PublishStructure::makeTree() {
    const Url tree = base();
    if (_files.makeCollection(tree)) return true;
    // The folders above belong to whoever runs the store; those that are missing are made, from the top.
    const Url bytes = *_session.endpoint(tree);
    std::vector<Url> above;
    for (Url u = bytes.cxURLByDeletingLastComponent(); !u.cxLastComponent().empty();
         u = u.cxURLByDeletingLastComponent())
        above.insert(above.begin(), u);
    for (const Url& u : above)
        _session.send(StoreSession::request("MKCOL", namedAsCollection(u)), [](int) { return true; });
    return _files.makeCollection(tree);
}

HttpRequest PublishStructure::making(const Url& collection) const {
    HttpRequest request = StoreSession::request("MKCOL", *_session.collectionEndpoint(collection));
    request.givesWay = true; // a pass that reads other people's trees need not wait for it
    return request;
}

// A file that must not replace another one.
HttpRequest PublishStructure::writingNew(const Url& name, const std::string& text) const {
    HttpRequest request = StoreSession::request("PUT", *_session.endpoint(name));
    request.headers = {{"If-None-Match", "*"}, {"Content-Type", "application/xml; charset=utf-8"}};
    request.body = std::make_shared<const std::string>(text);
    request.givesWay = true;
    return request;
}

// All at once. What exists already (405 and 412), because somebody else makes the structure too, is as good.
bool PublishStructure::makeAll(std::vector<HttpRequest> requests) {
    const std::vector<HttpRequest> asked = requests;
    const auto isThere = [](int status) { return status == 405 || status == 412; };
    const auto answers = _session.sendAll(std::move(requests),
                                          [](int status) { return status == 405 || status == 412 || status == 501; });
    bool all = true;
    for (size_t i = 0; i < answers.size(); ++i) {
        if (answers[i].ok() || isThere(answers[i].status) || writtenWithoutCondition(asked[i], answers[i])) continue;
        if (answers[i].status == 501) _session.noteFailure(asked[i].method, asked[i].url, answers[i]);
        all = false;
    }
    return all;
}

// A server that knows no "If-None-Match: *" is asked first whether the file is there.
bool PublishStructure::writtenWithoutCondition(HttpRequest request, const HttpResponse& answer) {
    if (request.method != "PUT" || answer.status != 501) return false;
    const int found = _session.send(StoreSession::request("GET", request.url), [](int s) { return s == 404; }).status;
    if (found != 404) return found == 200;
    std::erase_if(request.headers, [](const auto& header) { return header.first == "If-None-Match"; });
    return _session.send(std::move(request)).ok();
}

bool PublishStructure::complete(const Missing& missing) {
    const Url people = base().cxURLByAppendingComponent("People");
    if (missing.tree && !makeTree()) return false;
    if (missing.people && !makeAll({making(people)})) return false;
    std::vector<HttpRequest> rest;
    for (const int bucket : missing.buckets)
        rest.push_back(making(people.cxURLByAppendingComponent(std::to_string(bucket))));
    if (missing.dateFile) rest.push_back(writingNew(base().cxURLByAppendingComponent("dateFile"), "why"));
    if (missing.info) {
        const Dictionary info{{"SerialNumber", _serial.empty() ? makeUUID() : _serial}};
        rest.push_back(writingNew(base().cxURLByAppendingComponent("info"), PropertyList::toXML(info)));
    }
    return rest.empty() || makeAll(std::move(rest));
}

} // namespace rolvane
