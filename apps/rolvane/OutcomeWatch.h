#pragma once

#include "Context.h"

#include "engine/pass/PassOutcome.h"

#include <optional>

namespace rolvane::cli {

// Finds out how the passes went that began after this object was made. An outcome is taken from the preferences, and
// from the daemon's broadcast, which says it also where it could not be stored.
class OutcomeWatch {
public:
    explicit OutcomeWatch(Context& context);

    // Of the latest such pass; none so far.
    std::optional<PassOutcome> latest();
    // The same, but none while another pass is about to follow that belongs to it.
    std::optional<PassOutcome> settled();

private:
    PassWish _wish;
    std::optional<PassOutcome> _heard;
    ObservationHandle _observation;
};

} // namespace rolvane::cli
