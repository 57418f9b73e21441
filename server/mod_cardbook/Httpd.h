#pragma once

#include "server/HttpdHeaders.h"

extern "C" __attribute__((visibility("default"))) module AP_MODULE_DECLARE_DATA cardbook_module;
APLOG_USE_MODULE(cardbook);
