#pragma once

#include "server/mod_davacl/Configuration.h"
#include "server/mod_davacl/NewsRing.h"
#include "server/mod_davacl/TreePath.h"

namespace rolvane::davacl {

inline constexpr const char* kNewsHeader = "Rolvane-News";     // of an answer to OPTIONS: where to wait, and a position
inline constexpr const char* kWriterHeader = "Rolvane-Writer"; // of a request: what one program's changes are known by

// The ring of the running server; null where no host tells news.
NewsRing* newsRing();
// When the configuration has been read, in the process that will be forked. What is wrong, or null.
const char* prepareNews(server_rec* main);

// Tells all who wait that something at the place, or below it, is another one now. Not for a clock file, which a daemon
// writes in every pass.
void noteChange(const request_rec* r, const Configuration& c, const TreePath& place);
// Announces in the answer to OPTIONS where news can be had, where they can.
void announceNews(request_rec* r);
// Whether this request's host tells news, and its connection can wait for them.
bool tellsNews(const request_rec* r);

} // namespace rolvane::davacl
