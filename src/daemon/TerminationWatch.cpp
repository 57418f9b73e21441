#include "daemon/TerminationWatch.h"

#include <cerrno>
#include <csignal>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/signalfd.h>
#include <unistd.h>

namespace rolvane {

TerminationWatch::TerminationWatch(std::function<void()> terminate, double graceSeconds) {
    sigset_t set;
    sigemptyset(&set);
    for (int s : {SIGTERM, SIGINT, SIGHUP}) sigaddset(&set, s);
    pthread_sigmask(SIG_BLOCK, &set, nullptr);
    _signals = ::signalfd(-1, &set, SFD_CLOEXEC);
    _quit = ::eventfd(0, EFD_CLOEXEC);
    _thread = std::thread([this, terminate = std::move(terminate), graceSeconds] { serve(terminate, graceSeconds); });
}

TerminationWatch::~TerminationWatch() {
    const uint64_t one = 1;
    [[maybe_unused]] const ssize_t n = ::write(_quit, &one, sizeof one);
    _thread.join();
    ::close(_signals);
    ::close(_quit);
}

void TerminationWatch::serve(const std::function<void()>& terminate, double graceSeconds) {
    int timeout = -1;
    for (;;) {
        pollfd fds[2] = {{_signals, POLLIN, 0}, {_quit, POLLIN, 0}};
        const int ready = ::poll(fds, 2, timeout);
        if (ready < 0 && errno == EINTR) continue;
        if (fds[1].revents) return;
        if (ready == 0) ::_exit(0); // the grace has passed
        signalfd_siginfo info;
        if (::read(_signals, &info, sizeof info) != sizeof info) continue;
        if (timeout < 0) {
            timeout = static_cast<int>(graceSeconds * 1000);
            terminate();
        }
    }
}

} // namespace rolvane
