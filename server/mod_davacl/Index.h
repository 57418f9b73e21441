#pragma once

#include "server/mod_davacl/Httpd.h"

namespace rolvane::davacl {

// Answers GET and HEAD of a collection below the base with a plain page for a person: names, sizes and dates of the
// members that the request's user may read, each a relative link. The page needs no script and no style. It shows the
// first kMostShown members by name and tells how many there are besides. Declines any other request.
int serveIndex(request_rec* r) noexcept;

} // namespace rolvane::davacl
