#pragma once

#include "store/dav/CXDAVManager.h"

#include <optional>
#include <string>
#include <vector>

namespace rolvane {

// Remembers which URLs a process of this user locks, and by which tokens, so that the next run can take over or release
// the lock of one that was killed. One file a URL below `directory`, there as long as the lock may stand; empty:
// remembers nothing. A failure costs a wait, no more.
//
// A process may be killed before it hears of the token that it asked for. So a lock's owner, which everybody sees,
// carries a mark of the process that says nothing to others; which process it is stands below `directory`-runs.
class LockLedger {
public:
    explicit LockLedger(std::string directory) : _directory(std::move(directory)) {}
    // Before a lock is asked for. False, and nothing is noted, when somebody's note stands there already.
    bool expect(const std::string& url);
    void note(const std::string& url, const LockToken& token);
    void strike(const std::string& url);
    // The token of a process that has ended, or nothing.
    std::optional<LockToken> orphan(const std::string& url) const;
    struct Left {
        std::string url;
        LockToken token; // empty: the process was killed before it heard of one
    };
    std::vector<Left> leftByEndedRuns() const;
    // Of this process; written down before it is given out. Empty when it cannot be.
    std::string markOfThisRun() const;
    // Whether a lock's owner, as the store tells it, ends in the mark of a process of this user that has ended.
    bool isAnEndedRun(const std::string& owner) const;
    static LockLedger user(); // in the user's state directory

private:
    std::string pathFor(const std::string& url) const;
    std::string pathForRun(const std::string& mark) const;
    void write(const std::string& url, const LockToken& token);
    std::string _directory;
};

} // namespace rolvane
