#include "support/PseudoTerminal.h"

#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstring>
#include <stdexcept>
#include <utility>

#include <poll.h>
#include <pty.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

namespace rolvane::test {

namespace {

std::vector<char*> pointers(std::vector<std::string>& texts) {
    std::vector<char*> all;
    for (std::string& text : texts) all.push_back(text.data());
    all.push_back(nullptr);
    return all;
}

} // namespace

PseudoTerminal::PseudoTerminal(std::vector<std::string> command, std::vector<std::string> environment, Size size) {
    const std::vector<char*> arguments = pointers(command), variables = pointers(environment);
    const winsize window{size.rows, size.columns, 0, 0};
    _pid = ::forkpty(&_terminal, nullptr, nullptr, &window);
    if (_pid < 0) throw std::runtime_error("forkpty: " + std::string(std::strerror(errno)));
    if (_pid > 0) return;
    sigset_t none; // only what may be called between fork and exec
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    ::execvpe(arguments[0], arguments.data(), variables.data());
    ::_exit(127);
}

PseudoTerminal::~PseudoTerminal() {
    ::kill(_pid, SIGKILL);
    ::waitpid(_pid, nullptr, 0);
    ::close(_terminal);
}

void PseudoTerminal::type(const std::string& keys) {
    for (size_t done = 0; done < keys.size();) {
        const ssize_t n = ::write(_terminal, keys.data() + done, keys.size() - done);
        if (n < 0 && errno != EINTR) throw std::runtime_error("typing: " + std::string(std::strerror(errno)));
        if (n > 0) done += static_cast<size_t>(n);
    }
}

bool PseudoTerminal::readSome(double timeoutSeconds) {
    pollfd wanted{_terminal, POLLIN, 0};
    if (::poll(&wanted, 1, static_cast<int>(timeoutSeconds * 1000)) <= 0) return false;
    char bytes[4096];
    const ssize_t n = ::read(_terminal, bytes, sizeof bytes); // EIO when nobody has the terminal open any more
    if (n > 0) _shown.append(bytes, static_cast<size_t>(n));
    return n > 0;
}

std::string PseudoTerminal::readUntil(const std::string& text, double timeoutSeconds) {
    using Clock = std::chrono::steady_clock;
    const auto end = Clock::now() + std::chrono::duration<double>(timeoutSeconds);
    while (true) {
        if (const size_t found = _shown.find(text); found != std::string::npos) {
            const std::string given = _shown.substr(0, found + text.size());
            _shown.erase(0, given.size());
            return given;
        }
        const double left = std::chrono::duration<double>(end - Clock::now()).count();
        if (left <= 0 || !readSome(left)) return {};
    }
}

std::string PseudoTerminal::readToEnd(double timeoutSeconds) {
    while (readSome(timeoutSeconds)) {
    }
    return std::exchange(_shown, {});
}

} // namespace rolvane::test
