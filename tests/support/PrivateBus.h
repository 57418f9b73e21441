#pragma once

#include "support/ChildProcess.h"
#include "support/TempHome.h"

#include <memory>
#include <string>

namespace rolvane::test {

// A session bus of its own (dbus-daemon), serving when the constructor returns, killed at the end.
class PrivateBus {
public:
    PrivateBus();
    const std::string& address() const { return _address; }

    void kill();    // as a crash would
    void restart(); // serving again, at the same address
    void pause();   // accepts nothing and answers nothing
    void resume();

private:
    TempDirectory _directory;
    std::string _address;
    std::unique_ptr<ChildProcess> _daemon;
};

} // namespace rolvane::test
