#pragma once

#include "store/http/HttpTransport.h"

#include <string>
#include <string_view>

namespace rolvane {

// The one table of the answers that a WebDAV server gives. Portals, proxies and other web servers answer, too, and
// what they say must neither count as written nor as refused.
//
//   method     success                     needs proof                      everything else with 2xx
//   OPTIONS    a DAV class in the header   -                                foreign
//   PROPFIND   207, no web page;           -                                foreign
//              200 with a multistatus
//   GET, HEAD  200, no web page            200 with a web page              foreign
//   PUT        201, 204                    200, 202 and others              207 fails
//   DELETE     204; 207 that names no      200, 202 and others              any other 207 fails
//              failure
//   MKCOL      201                         200, 204 and others              207 fails
//   COPY, MOVE 201, 204                    -                                207 fails, else foreign
//   LOCK       200, 201 with activelock    -                                foreign
//   UNLOCK     204                         200 and others                   foreign
//   ACL        200, 201, 204, no web page  -                                207 fails, else foreign
//
//   every method: a redirect that only adds a slash to the same place is followed first (see Collections).
//   3xx and 4xx, and 501, are refusals; 401, 408, 429 and 5xx are failures; 407 and 511 are foreign.
//   Grave are 3xx, and of methods that change something all but 423, 412 to PUT, 405 to MKCOL: something follows from
//   them.
enum class AnswerVerdict {
    success,
    needsProof,   // a success that others give, too: the server shows that it is a WebDAV server, and what it has done
    graveRefusal, // to be believed of a server that proves itself now
    refusal,      // to be believed of a server that has proven itself not long ago
    failure,      // the request failed, whoever says so; nothing follows for what lies on the store
    foreign,      // no WebDAV server answers so: the store was not reached
};
AnswerVerdict verdictOn(std::string_view method, const HttpResponse& answer);

// Whether the body of an answer with 207 says of everything that it names that it is done, or was not there.
bool namesNoFailure(const HttpResponse& multistatus);

// Whether the answer carries a page for people: by its content type, or by how it begins where it has none.
bool isWebPage(const HttpResponse& answer);

// What the answer was, for a person ("PUT was answered with 200 and a web page").
std::string accountOf(std::string_view method, const HttpResponse& answer);

} // namespace rolvane
