#include "server/mod_cardbook/Resource.h"

#include "server/mod_cardbook/Repository.h"

#include <map>
#include <mutex>
#include <unistd.h>

namespace rolvane::cardbook {
namespace {

constexpr const char* kLibraryKey = "rolvane-cardbook-library";
constexpr size_t kMostIdle = 16;

// Libraries that no request uses, by their databases. They are opened in the worker processes only, never before a
// fork.
struct Idle {
    std::mutex mutex;
    std::map<std::string, std::vector<std::unique_ptr<Library>>> libraries;
};

Idle& idle() {
    static Idle* lasting = new Idle; // threads may still end requests while the process ends
    return *lasting;
}

struct Lent {
    std::string database;
    std::unique_ptr<Library> library;
    bool hasFailed = false;
};

apr_status_t giveBack(void* data) noexcept {
    std::unique_ptr<Lent> lent(static_cast<Lent*>(data));
    if (lent->hasFailed) return APR_SUCCESS;
    try {
        lent->library->rolvane().rollback();
        std::lock_guard lock(idle().mutex);
        auto& free = idle().libraries[lent->database];
        if (free.size() < kMostIdle) free.push_back(std::move(lent->library));
    } catch (const std::exception&) {
        lent->library.reset();
    }
    return APR_SUCCESS;
}

std::unique_ptr<Library> take(const std::string& database) {
    std::unique_ptr<Library> found;
    {
        std::lock_guard lock(idle().mutex);
        auto& free = idle().libraries[database];
        if (!free.empty()) {
            found = std::move(free.back());
            free.pop_back();
        }
    }
    if (found && !found->isOfPast()) return found;
    // Opening would make a new one, and every client that knows the old one would take its contacts for deleted.
    if (access(database.c_str(), F_OK) != 0 && access(bookMemoryPath(database).c_str(), F_OK) == 0)
        throw Refused(HTTP_INTERNAL_SERVER_ERROR, "There is no contact database " + database + " any more.");
    return std::make_unique<Library>(database);
}

request_rec* mainOf(request_rec* r) {
    while (r->main) r = r->main;
    return r;
}

Lent* lentTo(request_rec* r) {
    void* data = nullptr;
    apr_pool_userdata_get(&data, kLibraryKey, mainOf(r)->pool);
    return static_cast<Lent*>(data);
}

} // namespace

bool Resource::exists() const {
    switch (place.kind) {
    case Place::Kind::nowhere: return false;
    case Place::Kind::book: return book != nullptr;
    case Place::Kind::card: return member.has_value();
    default: return true;
    }
}

Library& libraryOf(request_rec* r) {
    const Configuration& c = configurationOf(r);
    if (!c.database) throw Refused(HTTP_INTERNAL_SERVER_ERROR, "CardBookDatabase names no contact database.");
    if (!r->user)
        throw Refused(HTTP_INTERNAL_SERVER_ERROR,
                      "Nobody is signed in: the books are served behind \"Require valid-user\" only.");
    if (Lent* lent = lentTo(r)) return *lent->library;
    auto fresh = std::make_unique<Lent>();
    fresh->database = c.database;
    fresh->library = take(fresh->database);
    fresh->library->catchUp();
    Lent* lent = fresh.release();
    apr_pool_userdata_setn(lent, kLibraryKey, nullptr, mainOf(r)->pool);
    apr_pool_cleanup_register(mainOf(r)->pool, lent, giveBack, apr_pool_cleanup_null);
    return *lent->library;
}

void dropLibrary(request_rec* r) {
    if (Lent* lent = lentTo(r)) lent->hasFailed = true;
}

dav_resource* newResource(apr_pool_t* pool, Resource resource) {
    auto* inside = new (apr_palloc(pool, sizeof(dav_resource_private))) dav_resource_private{std::move(resource)};
    apr_pool_cleanup_register(
        pool, inside,
        [](void* data) -> apr_status_t {
            static_cast<dav_resource_private*>(data)->~dav_resource_private();
            return APR_SUCCESS;
        },
        apr_pool_cleanup_null);
    auto* made = static_cast<dav_resource*>(apr_pcalloc(pool, sizeof(dav_resource)));
    const Resource& it = inside->it;
    made->type = DAV_RESOURCE_TYPE_REGULAR;
    made->exists = it.exists();
    made->collection = it.place.kind != Place::Kind::card && it.place.kind != Place::Kind::nowhere;
    made->uri = apr_pstrdup(pool, it.place.kind == Place::Kind::nowhere ? it.r->uri : it.path().c_str());
    made->info = inside;
    made->hooks = &kRepository;
    made->pool = pool;
    return made;
}

Resource& of(const dav_resource* resource) {
    return resource->info->it;
}

bool isOurs(const dav_resource* resource) {
    return resource->hooks == &kRepository;
}

bool isThunderbird(const request_rec* r) {
    const char* program = apr_table_get(r->headers_in, "User-Agent");
    return program && std::string_view(program).find("Thunderbird/") != std::string_view::npos;
}

dav_error* errorOf(apr_pool_t* pool, const Refused& refused) {
    const char* words = apr_pstrdup(pool, refused.words().c_str());
    if (refused.precondition().empty()) return dav_new_error(pool, refused.status(), 0, 0, words);
    const bool isDav = std::string_view(refused.space()) == kDavSpace;
    dav_error* error = dav_new_error_tag(pool, refused.status(), 0, 0, words, isDav ? nullptr : refused.space(),
                                         apr_pstrdup(pool, refused.precondition().c_str()));
    if (!refused.content().empty()) error->childtags = apr_pstrdup(pool, refused.content().c_str());
    return error;
}

dav_error* errorOfException(request_rec* r, const std::exception& e) noexcept {
    const auto* refused = dynamic_cast<const Refused*>(&e);
    if (refused && refused->status() != HTTP_INTERNAL_SERVER_ERROR) return errorOf(r->pool, *refused);
    ap_log_rerror(APLOG_MARK, APLOG_ERR, 0, r, "cardbook: %s", e.what());
    if (refused) return errorOf(r->pool, *refused);
    dropLibrary(r);
    const bool isBusy = std::string_view(e.what()).find("kept it locked") != std::string_view::npos;
    if (!isBusy)
        return dav_new_error(r->pool, HTTP_INTERNAL_SERVER_ERROR, 0, 0, "The contact database failed; see the log.");
    apr_table_setn(r->err_headers_out, "Retry-After", "5");
    return dav_new_error(r->pool, HTTP_SERVICE_UNAVAILABLE, 0, 0, "The contact database is in use; try again.");
}

} // namespace rolvane::cardbook
