#include "server/mod_cardbook/Writing.h"

#include "server/mod_cardbook/Resource.h"

namespace rolvane::cardbook {
namespace {

dav_error* readOnly(apr_pool_t* pool) {
    return dav_new_error_tag(pool, HTTP_FORBIDDEN, 0, 0, "The books are read-only.", nullptr, "need-privileges");
}

} // namespace

dav_error* openStream(const dav_resource* resource, dav_stream_mode, dav_stream**) noexcept {
    return readOnly(resource->pool);
}
dav_error* writeStream(dav_stream*, const void*, apr_size_t) noexcept {
    return nullptr;
}
dav_error* closeStream(dav_stream*, int) noexcept {
    return nullptr;
}
dav_error* removeResource(dav_resource* resource, dav_response**) noexcept {
    return readOnly(resource->pool);
}
dav_error* makeCollection(dav_resource* resource) noexcept {
    return readOnly(resource->pool);
}
dav_error* copyResource(const dav_resource* from, dav_resource*, int, dav_response**) noexcept {
    return readOnly(from->pool);
}
dav_error* moveResource(dav_resource* from, dav_resource*, dav_response**) noexcept {
    return readOnly(from->pool);
}

} // namespace rolvane::cardbook
