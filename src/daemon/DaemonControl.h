#pragma once

#include "foundation/CXException.h"

#include <optional>
#include <string>
#include <sys/types.h>

namespace rolvane {

// Starts, stops and finds the daemon of the user, for the contact application. Where a user service manager knows the
// unit RolvaneManager.service the manager does it; elsewhere the program is started directly, in a session of its own.
// Waits are bounded; failures are CXException "CXDaemonException" that say what to do.
class DaemonControl {
public:
    struct Options {
        std::string program;      // "": $ROLVANE_MANAGER, else beside this program, else the installed one
        double startSeconds = 20; // until it has checked in
        double stopSeconds = 10;  // until it has ended
        bool useServiceManager = true;
    };
    DaemonControl() : DaemonControl(Options{}) {}
    explicit DaemonControl(Options options);

    std::optional<pid_t> running() const;
    // True when it was started, false when it ran already. Returns when it has checked in.
    bool start() const;
    // True when one was stopped, false when none ran. Returns when it has ended.
    bool stop() const;
    void restart() const;
    // One pass in the foreground ("-p"): returns when the process has ended. Not while the daemon runs.
    void runOnce(double seconds) const;

    std::string programPath() const; // CXException when there is none
    static std::string logPath();    // where a directly started daemon's standard error goes

private:
    bool managed() const; // the service manager answers and knows the unit
    pid_t spawn(const std::string& notifySocket, bool once) const;

    Options _options;
};

} // namespace rolvane
