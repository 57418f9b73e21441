#include "server/mod_davacl/Locks.h"

#include "server/mod_davacl/Access.h"
#include "server/mod_davacl/GroupFile.h"

#include <algorithm>
#include <cstring>
#include <functional>

namespace rolvane::davacl {
namespace {

// The lock database, open as long as this object lives; none where mod_dav keeps no locks.
class LockDatabase {
public:
    LockDatabase(request_rec* r, bool readOnly) {
        if (!dav_get_lock_hooks(r)) return;
        if (dav_error* error = dav_open_lockdb(r, readOnly, &_database)) {
            _database = nullptr;
            ap_log_rerror(APLOG_MARK, APLOG_ERR, 0, r, "davacl: the locks cannot be read: %s", error->desc);
        }
    }
    ~LockDatabase() {
        if (_database) dav_close_lockdb(_database);
    }
    LockDatabase(const LockDatabase&) = delete;
    LockDatabase& operator=(const LockDatabase&) = delete;
    dav_lockdb* get() const { return _database; }

    const dav_lock* locksOn(const dav_resource* resource) const {
        dav_lock* first = nullptr;
        return _database && !dav_lock_query(_database, resource, &first) ? first : nullptr;
    }

private:
    dav_lockdb* _database = nullptr;
};

bool isOwn(const request_rec* r, const dav_lock& lock) {
    return lock.auth_user && r->user && std::strcmp(lock.auth_user, r->user) == 0;
}

// What is done with a collection and everything in it, locks on names without a file included.
struct Walk {
    request_rec* r;
    std::function<void(const dav_resource*)> visit;

    static dav_error* step(dav_walk_resource* visited, int) noexcept {
        const auto& walk = *static_cast<const Walk*>(visited->walk_ctx);
        contained(walk.r, false, [&] {
            walk.visit(visited->resource);
            return true;
        });
        return nullptr;
    }
    void over(const dav_resource* collection, dav_lockdb* database) {
        dav_walk_params parameters{};
        parameters.walk_type = DAV_WALKTYPE_NORMAL | DAV_WALKTYPE_LOCKNULL;
        parameters.func = step;
        parameters.walk_ctx = this;
        parameters.pool = r->pool;
        parameters.root = collection;
        parameters.lockdb = database;
        dav_response* responses = nullptr;
        if (dav_error* error = collection->hooks->walk(&parameters, DAV_INFINITY, &responses))
            ap_log_rerror(APLOG_MARK, APLOG_ERR, 0, r, "davacl: the locks below %s were not all looked at: %s", r->uri,
                          error->desc);
    }
};

// The locks that their holders may not hold any more, by these lists.
class Forfeited {
public:
    Forfeited(request_rec* r, const Configuration& c, const OwnersLists& lists, const LockDatabase& database)
        : _r(r), _c(c), _lists(lists), _database(database),
          _groups(c.groupFile ? readableText(c.groupFile) : std::nullopt) {}

    void find(const dav_resource* resource) {
        const auto place = TreePath::of(_c.base, resource->uri);
        if (!place) return;
        for (const dav_lock* lock = _database.locksOn(resource); lock; lock = lock->next)
            if (!mayHold(*lock, *place) && !isKnown(lock->locktoken)) _tokens.push_back(lock->locktoken);
    }
    void remove(const dav_resource* resource) const {
        dav_lockdb* database = _database.get();
        for (const dav_locktoken* token : _tokens)
            if (dav_error* error = database->hooks->remove_lock(database, resource, token))
                ap_log_rerror(APLOG_MARK, APLOG_ERR, 0, _r, "davacl: a lock on %s cannot be taken away: %s",
                              resource->uri, error->desc);
    }
    bool empty() const { return _tokens.empty(); }

private:
    bool mayHold(const dav_lock& lock, const TreePath& place) const {
        if (!lock.auth_user) return false;
        const Caller holder{lock.auth_user, _groups ? groupsOf(lock.auth_user, *_groups) : std::set<std::string>(),
                            _groups.has_value()};
        return place.owner == holder.name || (_lists.granted(holder, place.below) & kWriteContent);
    }
    bool isKnown(const dav_locktoken* token) const {
        const auto compare = _database.get()->hooks->compare_locktoken;
        return std::any_of(_tokens.begin(), _tokens.end(),
                           [&](const dav_locktoken* known) { return compare(known, token) == 0; });
    }

    request_rec* _r;
    const Configuration& _c;
    const OwnersLists& _lists;
    const LockDatabase& _database;
    const std::optional<std::string> _groups;  // the group file
    std::vector<const dav_locktoken*> _tokens; // of the request's pool
};

} // namespace

bool isLockedByOthersOnly(request_rec* r, const dav_resource* resource) {
    const LockDatabase database(r, true);
    const dav_lock* first = database.locksOn(resource);
    for (const dav_lock* lock = first; lock; lock = lock->next)
        if (isOwn(r, *lock)) return false;
    return first != nullptr;
}

bool namesOwnLock(request_rec* r) {
    const char* text = apr_table_get(r->headers_in, "Lock-Token");
    const dav_hooks_locks* hooks = dav_get_lock_hooks(r);
    if (!text || !hooks || *text != '<') return false;
    char* token = apr_pstrdup(r->pool, text + 1);
    if (char* end = std::strchr(token, '>')) *end = '\0';
    dav_locktoken* wanted = nullptr;
    dav_resource* resource = nullptr;
    if (hooks->parse_locktoken(r->pool, token, &wanted) || dav_get_resource(r, 0, 0, &resource)) return false;
    const LockDatabase database(r, true);
    for (const dav_lock* lock = database.locksOn(resource); lock; lock = lock->next)
        if (isOwn(r, *lock) && hooks->compare_locktoken(lock->locktoken, wanted) == 0) return true;
    return false;
}

void removeLocksWithoutRight(request_rec* r, const Configuration& c, const dav_resource* collection,
                             const OwnersLists& lists) {
    const LockDatabase database(r, false);
    if (!database.get()) return;
    // A lock on a collection is found at each of its members by way of the collection: it is taken away when all are
    // found.
    Forfeited forfeited(r, c, lists, database);
    Walk{r, [&](const dav_resource* resource) { forfeited.find(resource); }}.over(collection, database.get());
    if (forfeited.empty()) return;
    Walk{r, [&](const dav_resource* resource) { forfeited.remove(resource); }}.over(collection, database.get());
}

} // namespace rolvane::davacl
