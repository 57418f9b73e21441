#pragma once

#include "server/mod_cardbook/Httpd.h"

namespace rolvane::cardbook {

// mod_dav's hooks that change something.
dav_error* openStream(const dav_resource* resource, dav_stream_mode mode, dav_stream** stream) noexcept;
dav_error* writeStream(dav_stream* stream, const void* bytes, apr_size_t count) noexcept;
dav_error* closeStream(dav_stream* stream, int commit) noexcept;
dav_error* removeResource(dav_resource* resource, dav_response** response) noexcept;
dav_error* makeCollection(dav_resource* resource) noexcept;
dav_error* copyResource(const dav_resource* from, dav_resource* to, int depth, dav_response** response) noexcept;
dav_error* moveResource(dav_resource* from, dav_resource* to, dav_response** response) noexcept;

} // namespace rolvane::cardbook
