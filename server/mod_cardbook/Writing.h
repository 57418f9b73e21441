#pragma once

#include "server/mod_cardbook/Httpd.h"

namespace rolvane::cardbook {

// mod_dav's hooks that change something.
// A hook of mod_dav, before anything is done.
int prepareMethod(request_rec* r, dav_resource* source, const dav_resource* destination, const apr_xml_doc* doc,
                  dav_error** error) noexcept;
dav_error* openStream(const dav_resource* resource, dav_stream_mode mode, dav_stream** stream) noexcept;
dav_error* writeStream(dav_stream* stream, const void* bytes, apr_size_t count) noexcept;
dav_error* closeStream(dav_stream* stream, int commit) noexcept;
dav_error* removeResource(dav_resource* resource, dav_response** response) noexcept;
dav_error* makeCollection(dav_resource* resource) noexcept;
dav_error* copyResource(const dav_resource* from, dav_resource* to, int depth, dav_response** response) noexcept;
dav_error* moveResource(dav_resource* from, dav_resource* to, dav_response** response) noexcept;

} // namespace rolvane::cardbook
