#pragma once

#include "Context.h"

#include "engine/pass/PassOutcome.h"
#include "store/account/StoreTrial.h"

#include <optional>
#include <string>

namespace rolvane::cli {

// A failure for a person. Both are whole sentences.
struct FailureText {
    ExitCode code = kFailed;
    std::string what; // what was asked, what the store said
    std::string toDo; // what to do about it
};

// Whose tree it is about, and who asks.
struct FailureScene {
    std::string store;  // the endpoint's origin
    std::string self;   // the account's user
    std::string user;   // of the tree; empty for the account's own, or the store as a whole
    bool reads = false; // the request was to read the tree
    Date at;            // when it happened
};

// The one table from a store's answers to advice. Pure.
FailureText failureText(const PassFailure& failure, const FailureScene& scene);

// The one error of a command that needs the account and finds none.
CommandError noAccount();

// The account's store and user; without an account both are empty.
FailureScene sceneOfTheAccount(Date at);

// Asks the store now. Nothing: it can be used.
std::optional<PassFailure> testStore();
// The same, with some patience where it may be over in a moment, as the error that a command ends with; `nothingDone`
// stands at its end.
void requireStore(Context& context, const std::string& nothingDone);

// The error of a store that cannot be used; `consequence` follows the reason, as a sentence.
CommandError hinderedBy(const StoreTrial::Hindrance& hindrance, const std::string& consequence);
// Tries the account's store, which has been reached, as `account test` does. Throws when it is of a kind that cannot
// be used; what may be over in a moment is left to the passes.
void requireUsableStore(const std::string& nothingDone);

nlohmann::ordered_json failureJson(const PassFailure& failure, const FailureScene& scene);

} // namespace rolvane::cli
