#pragma once

#include <string>
#include <vector>

#include <sys/types.h>

namespace rolvane::test {

// A program in a terminal of its own. Killed and reaped when this object ends. Used by one thread.
class PseudoTerminal {
public:
    struct Size {
        unsigned short columns = 80, rows = 24;
    };
    // Throws std::runtime_error when it cannot be started. `environment` holds "NAME=value" each.
    PseudoTerminal(std::vector<std::string> command, std::vector<std::string> environment, Size size);
    ~PseudoTerminal();
    PseudoTerminal(const PseudoTerminal&) = delete;
    PseudoTerminal& operator=(const PseudoTerminal&) = delete;

    void type(const std::string& keys);
    // All that was shown since the last call, up to the first place of the text and with it. "" when the time ran out
    // or the program ended without it.
    std::string readUntil(const std::string& text, double timeoutSeconds = 60);
    std::string readToEnd(double timeoutSeconds = 60); // until the program ends

private:
    bool readSome(double timeoutSeconds);
    pid_t _pid = -1;
    int _terminal = -1;
    std::string _shown; // and not yet given
};

} // namespace rolvane::test
