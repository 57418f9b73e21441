#pragma once

#include "contacts/database/CXRolvane.h"

#include <mutex>

namespace rolvane {

// While it lives, everything that this thread reads is of one moment, and what it changes is taken to have been made
// against that: what other programs save meanwhile is merged by the next save. Operations of other threads wait. Short
// lived; nothing is saved meanwhile.
class OneTurn {
public:
    explicit OneTurn(CXRolvane& rolvane);
    OneTurn(const OneTurn&) = delete;
    OneTurn& operator=(const OneTurn&) = delete;

private:
    std::unique_lock<std::recursive_mutex> _lock;
    CXRolvane::OneMoment _moment;
};

} // namespace rolvane
