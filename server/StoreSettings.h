#pragma once

#include "server/PrivateStore.h"

#include <string>

namespace rolvane {

// The settings of a store for several households, as its administrator writes them:
//
//   # a comment
//   name = dav.example.org
//   certificate = acme
//
// A line for each setting, in any order; docs/household.md has them all. A pure function of texts.

// The options with what the settings say. CXException names the line that cannot be used, or the setting that is
// missing.
PrivateStoreOptions withStoreSettings(PrivateStoreOptions options, const std::string& text);

// Where the package rolvane-store keeps its store, and the user whom it runs as.
struct SystemStore {
    static constexpr const char* kSettings = "/etc/rolvane-store/store.conf";
    static constexpr const char* kDirectory = "/var/lib/rolvane-store";
    static constexpr const char* kUser = "rolvane-store";
    static constexpr const char* kUnit = "rolvane-store.service";
};

// "500M", "2G", "1048576" or "none": a size that the module takes for a quota.
bool isQuota(const std::string& text);

} // namespace rolvane
