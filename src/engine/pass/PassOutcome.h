#pragma once

#include "foundation/Date.h"
#include "foundation/StrongString.h"
#include "foundation/Value.h"

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

class Preferences;

// Key of the daemon's domain: the outcome of the last pass. Broadcast as the user data of the notification, too, so
// that it is heard where it could not be stored.
inline constexpr const char* kCXDPassOutcome = "CXDPassOutcome";
inline constexpr const char* kCXDPassEndedNotification = "CXDPassEndedNotification";

// Why something was not done: a request that failed, or a test of the store that did.
struct PassFailure {
    std::string method;                      // empty where no single request is to blame
    std::string url;                         // the name that it was about; may be empty
    int status = 0;                          // the server's; 0: no answer came that can be believed
    int error = 0;                           // where status is 0: kCXDAVError…, else 0
    std::string words;                       // the server's own, or what kept the answer away; one line
    std::optional<double> retryAfterSeconds; // from the end of the pass on, where the server has said so

    friend bool operator==(const PassFailure&, const PassFailure&) = default;
};

// One direction of one tree. Counts are of change records.
struct PassDirection {
    bool asked = false;               // the pass had to use the tree in this direction
    bool reached = false;             // the tree was used so; of a tree that is read: it was read whole
    int64_t carried = 0;              // what went out, or came in
    int64_t waiting = 0;              // what waits after the pass
    int64_t refused = 0;              // what was given up; with what the pass was refused whose retry this one is
    std::optional<Date> inStep;       // the end of the last pass that left nothing
    std::optional<Date> waitingSince; // the end of the first pass of those that did since; none: nothing is left
    std::optional<PassFailure> why;   // what is left was left for this

    friend bool operator==(const PassDirection&, const PassDirection&) = default;
};

struct PassTree {
    UserName user;          // "<self>": the own
    std::string location;   // the base location
    bool ended = false;     // this pass ended the publication, or the subscription
    bool leftAlone = false; // it was read and is not what it was: its owner's daemon has to mend it
    bool listsWait = false; // access lists that the store does not have yet
    PassDirection out, in;

    friend bool operator==(const PassTree&, const PassTree&) = default;
};

// How a pass has ended, put down once, at its end. A value.
struct PassOutcome {
    int64_t number = 0; // counts the passes that have ended, from 1
    Date began, ended;
    double beganSinceBoot = 0;               // secondsSinceBoot
    bool full = false;                       // it looked at the database and the trees; else it carried changes alone
    bool storeReached = false;               // somebody answered there, as a WebDAV server does
    bool anotherFollows = false;             // a pass that was asked for waits on the run loop
    std::optional<PassFailure> storeFailure; // why it was not reached
    std::optional<std::string> exception;    // what has ended the pass
    std::optional<std::string> storage;      // the database, or the preferences, could not be read or written
    std::vector<PassTree> trees;             // everything shared that concerns the network store; the own first

    const PassTree* tree(const UserName& user) const;

    friend bool operator==(const PassOutcome&, const PassOutcome&) = default;
};

Value encodeOutcome(const PassOutcome& outcome); // a dictionary, as docs/formats.md has it
// Nothing for what is none. What is missing in it is as in a new value.
std::optional<PassOutcome> decodeOutcome(const Value& value);

// The outcome of the last pass that has ended, of whatever process; none before the first. Throws as Preferences::get.
std::optional<PassOutcome> lastOutcome(const Preferences& preferences);

// The pass came to its end, and what it has done is stored.
bool isComplete(const PassOutcome& outcome);
// Complete, and nothing waits to be sent nor was refused.
bool everythingIsSent(const PassOutcome& outcome);
// A full pass that read every tree, left nothing and was refused nothing, and has no other to follow it.
bool everythingIsUpToDate(const PassOutcome& outcome);
// The failure that is to be told where one line has room for one: of the pass, of what goes out, of what comes in.
std::optional<PassFailure> firstFailure(const PassOutcome& outcome);

// What somebody who waits for a pass keeps from the moment of the wish, to know the pass that began after it.
struct PassWish {
    int64_t after = 0; // the number of the last outcome
    double sinceBoot = 0;
};
PassWish wishForAPass(const Preferences& preferences); // now
bool answers(const PassOutcome& outcome, const PassWish& wish);

} // namespace rolvane
