#pragma once

#include "CommandWorld.h"

namespace rolvane::test {

// A command on a terminal of its own, through script(1): standard input, output and error are that terminal.
class TerminalSession {
public:
    explicit TerminalSession(const std::string& commandLine, const std::vector<std::string>& environment,
                             const std::string& directory = {});

    // Waits until the text stands behind what was answered before, then types the answer and Enter.
    testing::AssertionResult answer(const std::string& prompt, const std::string& text);
    // The command's exit code; -1 when it did not end.
    int end(double seconds = 120);
    // All that the terminal showed, lines ended by LF alone.
    std::string shown() const;

private:
    ChildProcess _script;
    size_t _answered = 0; // how far `shown` had come
};

// "'it'\''s'"
std::string quotedForShell(const std::string& word);

} // namespace rolvane::test
