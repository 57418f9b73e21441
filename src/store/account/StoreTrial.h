#pragma once

#include "store/dav/CXDAVManager.h"

#include <optional>
#include <string>

namespace rolvane {

// What a store does with a folder and a file that are made for the trial and taken away again.
struct StoreTrial {
    // The step without which nothing can be published there, in a sentence for a person, and the answer's status (0:
    // none that can be believed). Absent: the store can be used.
    struct Hindrance {
        std::string what;
        int status = 0;
        bool lasts = false; // the store is like that: another attempt will meet it, too
        enum class Remedy { endpoint, rights, locks } remedy = Remedy::endpoint; // where to look
    };
    std::optional<Hindrance> hindrance;

    bool dates = false;       // its listings tell when files were written
    bool tags = false;        // its listings tell versions by entity tags
    bool locks = false;       // a file is locked, and written under the lock
    bool conditions = false;  // a write that names another version than the store's is refused
    bool accessLists = false; // it announces them (RFC 3744)
};

// Makes a folder and a file in the account's own tree, reads, lists, locks, changes and deletes them. A tree that is
// not there is made for it and taken away again, with the folders above that were missing. Some fifteen requests;
// waits.
StoreTrial tryStore(CXDAVManager& store);

} // namespace rolvane
