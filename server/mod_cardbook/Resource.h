#pragma once

#include "server/mod_cardbook/Configuration.h"
#include "server/mod_cardbook/Library.h"
#include "server/mod_cardbook/Refused.h"

#include <memory>

namespace rolvane::cardbook {

// The thing that a path of the books names, for one request.
struct Resource {
    request_rec* r = nullptr;
    Library* library = nullptr; // lives as long as the request
    std::string base;           // without a slash at the end
    Place place;
    std::shared_ptr<const Book> book; // of a book and a card; null: there is none
    std::optional<Member> member;     // of a card; nothing: there is none
    std::optional<Card> card;         // once its text was asked for
    bool isReplaced = false;          // the destination of a COPY or MOVE, which sees to it itself

    bool exists() const;
    std::string path() const { return pathOf(base, place); }
    std::string path(const Place& of) const { return pathOf(base, of); }
};

// The library of a request, its sub-requests' too: caught up, and given back for others when the request ends. Throws
// Refused where none is configured or nobody is signed in.
Library& libraryOf(request_rec* r);
// Something has failed in it: nobody gets it after this request.
void dropLibrary(request_rec* r);

// mod_dav's form of it, in the pool; its paths are whole ones.
dav_resource* newResource(apr_pool_t* pool, Resource resource);
Resource& of(const dav_resource* resource);
bool isOurs(const dav_resource* resource);

// Does the request say that it is Thunderbird's? Some refusals it does not get over.
bool isThunderbird(const request_rec* r);

// An error as mod_dav sends it. Never null.
dav_error* errorOf(apr_pool_t* pool, const Refused& refused);

// httpd is C: whatever is thrown in a hook ends here. Null when nothing was.
template <class Hook>
dav_error* contained(request_rec* r, Hook hook) noexcept;
dav_error* errorOfException(request_rec* r, const std::exception& e) noexcept;

template <class Hook>
dav_error* contained(request_rec* r, Hook hook) noexcept {
    try {
        hook();
        return nullptr;
    } catch (const std::exception& e) {
        return errorOfException(r, e);
    }
}

} // namespace rolvane::cardbook

struct dav_resource_private {
    rolvane::cardbook::Resource it;
};
