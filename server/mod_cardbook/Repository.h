#pragma once

#include "server/mod_cardbook/Httpd.h"

namespace rolvane::cardbook {

// mod_dav's provider "cardbook": resources, their bodies, and what changes them. No locks and no properties but those
// that are computed.
extern const dav_hooks_repository kRepository;
extern const dav_provider kProvider;

} // namespace rolvane::cardbook
