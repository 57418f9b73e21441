#include "server/mod_davacl/QuotaTurn.h"

#include "server/mod_davacl/Access.h"

#include <apr_dbm.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace rolvane::davacl {
namespace {

uint64_t generation = 0; // set before the processes are forked

bool is(const request_rec* r, const char* method) {
    return std::strcmp(r->method, method) == 0;
}

uint64_t quotaOf(const Configuration& c, const std::string& owner) {
    if (c.quotaFile)
        if (const auto own = quotaInFile(fileText(c.quotaFile), owner)) return *own;
    return c.quota;
}

// The owner's directory, from that of a place in it.
std::string treeOf(const QuotaTurn::Place& place) {
    std::string path = place.path;
    for (size_t i = 0; i < place.tree.below.size(); ++i) path.resize(std::min(path.rfind('/'), path.size()));
    return path;
}

std::unique_ptr<QuotaLedger> ledgerOf(request_rec* r, const Configuration& c, const QuotaTurn::Place& place) {
    const std::string& owner = place.tree.owner;
    auto ledger = std::make_unique<QuotaLedger>(ListStore(c.lists).pathFor(owner, ".used"), generation, treeOf(place));
    if (ledger->open()) return ledger;
    ap_log_rerror(APLOG_MARK, APLOG_ERR, errno, r, "davacl: the room that %s takes cannot be counted (%s)",
                  owner.c_str(), ListStore(c.lists).pathFor(owner, ".used").c_str());
    return nullptr;
}

// The files in which mod_dav_fs keeps the properties of a place.
std::vector<std::string> propertyFilesOf(request_rec* r, const QuotaTurn::Place& place) {
    const size_t slash = place.path.rfind('/');
    const std::string base = place.collection ? place.path + "/.DAV/.state_for_dir"
                                              : place.path.substr(0, slash) + "/.DAV/" + place.path.substr(slash + 1);
    const char *first = nullptr, *second = nullptr;
    apr_dbm_get_usednames(r->pool, base.c_str(), &first, &second);
    std::vector<std::string> files;
    for (const char* each : {first, second})
        if (each) files.emplace_back(each);
    return files;
}

// Methods that take a collection with all its members.
bool takesMembers(const request_rec* r) {
    return is(r, "DELETE") || is(r, "MOVE") || is(r, "COPY");
}

uint64_t announcedBytes(const request_rec* r) {
    const char* length = apr_table_get(r->headers_in, "Content-Length");
    apr_off_t bytes = 0;
    char* end = nullptr;
    return length && apr_strtoff(&bytes, length, &end, 10) == APR_SUCCESS && !*end && bytes > 0
               ? static_cast<uint64_t>(bytes)
               : 0;
}

} // namespace

void prepareQuotas() {
    generation = static_cast<uint64_t>(apr_time_now());
}

std::optional<QuotaTurn::Place> quotaPlaceOf(const request_rec* r, const std::optional<TreePath>& place) {
    if (!r->filename || !place || place->isBase()) return std::nullopt;
    std::string path = std::string(r->filename) + (r->path_info ? r->path_info : "");
    path.resize(path.find_last_not_of('/') + 1);
    return QuotaTurn::Place{*place, std::move(path), standingOf(r) == Standing::collection};
}

QuotaTurn::QuotaTurn(request_rec* r, const Configuration& c, std::optional<Place> source,
                     std::optional<Place> destination)
    : _source(std::move(source)), _destination(std::move(destination)) {
    const char* provider = dav_get_provider_name(r);
    if (!c.keepsQuotas() || !provider || std::strcmp(provider, "filesystem") != 0) return;
    _r = r;
    _c = &c;
}

uint64_t QuotaTurn::roomOfSource() const {
    if (!_source) return kRoomUnit; // of somewhere that has no owner
    return roomTaken(_source->path, isDeep(_r));
}

// How much more the payer's tree takes behind the request, as far as that is known before.
int64_t QuotaTurn::growth(uint64_t received) const {
    const auto room = [](uint64_t bytes) { return static_cast<int64_t>(std::min<uint64_t>(bytes, INT64_MAX)); };
    const int64_t there = room(roomTaken(payer()->path, is(_r, "COPY") || is(_r, "MOVE")));
    if (is(_r, "PUT")) return room(roomOfBytes(received)) - there;
    if (is(_r, "MKCOL") || is(_r, "LOCK")) return there ? 0 : room(kRoomUnit);
    if (is(_r, "MOVE") && _source && _destination && _source->tree.owner == _destination->tree.owner) return 0;
    if (is(_r, "COPY") || is(_r, "MOVE")) return _destination ? room(roomOfSource()) - there : 0;
    return is(_r, "DELETE") ? 0 : room(roomOfBytes(received));
}

bool QuotaTurn::hasRoom(uint64_t used, int64_t more) const {
    const uint64_t quota = quotaOf(*_c, payer()->tree.owner);
    if (more <= 0 || quota == kNoQuota) return true;
    if (used <= quota && static_cast<uint64_t>(more) <= quota - used) return true;
    ap_log_rerror(APLOG_MARK, APLOG_INFO, 0, _r, "davacl: %s of %s has no room: %s takes %llu bytes and may take %llu",
                  _r->method, _r->uri, payer()->tree.owner.c_str(), static_cast<unsigned long long>(used),
                  static_cast<unsigned long long>(quota));
    return false;
}

bool QuotaTurn::mayBegin() {
    if (!_r || !payer() || !ap_request_has_body(_r)) return true;
    const auto ledger = ledgerOf(_r, *_c, *payer());
    if (!ledger) return true; // `begin` says what may go on without
    const uint64_t quota = quotaOf(*_c, payer()->tree.owner);
    const uint64_t free = quota - std::min(quota, ledger->used());
    if (quota != kNoQuota) _most = free + roomTaken(payer()->path, false);
    return hasRoom(ledger->used(), growth(announcedBytes(_r)));
}

void QuotaTurn::measure(const Place& place) {
    const auto add = [&](const std::string& path, bool deep) {
        _places.try_emplace(path, Measured{place.tree.owner, deep, roomTaken(path, deep)});
    };
    add(place.path, takesMembers(_r));
    if (takesMembers(_r) && place.collection) return; // its properties lie in it
    for (const std::string& file : propertyFilesOf(_r, place)) add(file, false);
}

bool QuotaTurn::begin(uint64_t received) {
    if (!_r || !payer() || !_places.empty()) return true;
    for (const auto* place : {&_source, &_destination}) // in one order for everybody: nobody waits in a circle
        if (*place) _ledgers.try_emplace((*place)->tree.owner);
    bool counted = true;
    for (auto& [owner, ledger] : _ledgers) {
        ledger = ledgerOf(_r, *_c, _source && _source->tree.owner == owner ? *_source : *_destination);
        counted = counted && ledger;
    }
    const int64_t more = growth(received);
    // Where nothing can be counted a tree may still become smaller.
    if (counted ? !hasRoom(_ledgers[payer()->tree.owner]->used(), more) : more > 0) {
        _ledgers.clear();
        return false;
    }
    for (const auto* place : {&_source, &_destination})
        if (*place) measure(**place);
    return true;
}

void QuotaTurn::end() {
    for (const auto& [path, place] : _places) {
        const auto& ledger = _ledgers[place.owner];
        const auto difference = static_cast<int64_t>(roomTaken(path, place.deep) - place.before);
        if (ledger && !ledger->add(difference))
            ap_log_rerror(APLOG_MARK, APLOG_ERR, errno, _r, "davacl: the room that %s takes cannot be noted",
                          place.owner.c_str());
    }
    _places.clear();
    _ledgers.clear();
}

int refuseForRoom(request_rec* r) {
    return dav_handle_err(r,
                          dav_new_error_tag(r->pool, HTTP_INSUFFICIENT_STORAGE, 0, 0,
                                            "The quota of the tree's owner leaves no room for it.",
                                            "DAV:", "quota-not-exceeded"),
                          nullptr);
}

std::optional<QuotaFigures> quotaFiguresOf(request_rec* r, const Configuration& c, const QuotaTurn::Place& place) {
    if (!c.keepsQuotas()) return std::nullopt;
    const auto ledger = ledgerOf(r, c, place);
    if (!ledger) return std::nullopt;
    QuotaFigures figures{ledger->used(), std::nullopt};
    if (const uint64_t quota = quotaOf(c, place.tree.owner); quota != kNoQuota)
        figures.available = quota - std::min(quota, figures.used);
    return figures;
}

} // namespace rolvane::davacl
