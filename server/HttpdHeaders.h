#pragma once

// httpd's headers for both modules, in the one order in which C++ can read them: mod_dav.h has parameters and fields
// called "namespace".
#include <httpd.h>

#include <apr_strings.h>
#include <http_config.h>
#include <http_core.h>
#include <http_log.h>
#include <http_protocol.h>
#include <http_request.h>
#include <util_filter.h>
#include <util_xml.h>

// These are read by mod_dav.h too, and have to be before the word changes its meaning.
#include <ctime>
#include <string>
#ifdef __clang__
#pragma clang diagnostic push
#pragma clang diagnostic ignored "-Wkeyword-macro"
#endif
#define namespace namespace_
#include <mod_dav.h>
#undef namespace
#ifdef __clang__
#pragma clang diagnostic pop
#endif
