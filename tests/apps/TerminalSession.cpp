#include "TerminalSession.h"

#include "support/WaitUntil.h"

namespace rolvane::test {

TerminalSession::TerminalSession(const std::string& commandLine, const std::vector<std::string>& environment,
                                 const std::string& directory)
    : _script({.arguments = {"script", "-qefc", commandLine, "/dev/null"},
               .environment = environment,
               .directory = directory}) {}

testing::AssertionResult TerminalSession::answer(const std::string& prompt, const std::string& text) {
    size_t found = std::string::npos;
    const auto came = waitUntil(
        [&] {
            found = shown().find(prompt, _answered);
            return found != std::string::npos || !_script.running();
        },
        "the prompt \"" + prompt + "\"", 120);
    if (found == std::string::npos) return testing::AssertionFailure() << "no \"" << prompt << "\" in:\n" << shown();
    _answered = found + prompt.size();
    _script.writeInput(text + "\n");
    return came;
}

int TerminalSession::end(double seconds) {
    const auto ending = _script.wait(seconds);
    if (!ending) _script.kill();
    return ending && ending->signal == 0 ? ending->status : -1;
}

std::string TerminalSession::shown() const {
    std::string text = _script.output();
    std::erase(text, '\r');
    return text;
}

std::string quotedForShell(const std::string& word) {
    std::string text = "'";
    for (const char c : word) text += c == '\'' ? std::string("'\\''") : std::string(1, c);
    return text + "'";
}

} // namespace rolvane::test
