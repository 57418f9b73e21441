#pragma once

#include "foundation/Url.h"
#include "store/http/HttpTransport.h"

#include <optional>
#include <string>

namespace rolvane {

// A collection is named with a slash at its end (RFC 4918 section 5.2). Servers answer the name without it variously:
// as if it stood there, with a redirect, or with 409.

// The URL with a slash at its end.
Url namedAsCollection(const Url& url);
// Whether the name is one that is always a collection: a tree, its "People", or a bucket in that.
bool isAlwaysCollection(const Url& name);

// Where the answer sends the client (RFC 9110 section 15.4), as an absolute URL when it can be read as one, else as
// the server wrote it; "" when it does not send it anywhere.
std::string redirectTarget(const Url& asked, const HttpResponse& answer);
// What was asked for with a slash at its end, when the answer sends the client just there, on the same origin and for
// the same method. Nothing for every other answer.
std::optional<Url> redirectToCollection(const Url& asked, const HttpResponse& answer);
// The same request to that place: conditions on the place itself name it, too.
HttpRequest sentTo(HttpRequest request, const Url& place);

} // namespace rolvane
