#pragma once

#include "engine/pass/PassOutcome.h"
#include "model/CXDChangeRecord.h"
#include "model/TreeLook.h"

#include <map>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

// What is noted in the course of one pass. A value.
struct PassFacts {
    struct Counts {
        int64_t sent = 0, received = 0; // applied to the store, or to the database
        int64_t refused = 0;
        int64_t resting = 0;               // refused, in this pass or earlier, and to be made anew later
        int64_t toSend = 0, toReceive = 0; // left over
        bool toldToSend = false;           // the pass tried to send something there
    };
    struct Shared {
        UserName user;
        std::string location;
        bool listsWait = false;
    };

    Date began;
    double beganSinceBoot = 0;
    bool full = false;
    bool retry = false; // of the pass before, for what that was refused
    bool storeReached = false;
    bool anotherFollows = false;
    std::optional<PassFailure> storeFailure;
    std::optional<std::string> exception, storage;
    std::map<UserName, TreeLook> looks;
    std::map<UserName, Counts> counts;
    std::optional<std::vector<Shared>> shared; // as the database has it at the end; none: it could not be read
    std::vector<PassFailure> failures;         // of requests, in order
};

// Adds what is left for the network store or has come from it.
void countLeftOver(PassFacts& facts, const CXDChangeRecords& pending);

// `previous`: none before the first pass. Dates of trees go on from there.
PassOutcome outcomeOf(const PassFacts& facts, const std::optional<PassOutcome>& previous, Date ended);

} // namespace rolvane
