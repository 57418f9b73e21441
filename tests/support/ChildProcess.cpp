#include "support/ChildProcess.h"

#include "support/TerminationTrace.h"

#include <array>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstring>
#include <regex>
#include <stdexcept>

#include <fcntl.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

namespace rolvane::test {

namespace {

struct Pipe {
    int read = -1, write = -1;
    Pipe() {
        int ends[2];
        if (::pipe2(ends, O_CLOEXEC) < 0) throw std::runtime_error("pipe: " + std::string(std::strerror(errno)));
        read = ends[0];
        write = ends[1];
    }
};

std::vector<char*> pointers(const std::vector<std::string>& texts) {
    std::vector<char*> out;
    for (const auto& text : texts) out.push_back(const_cast<char*>(text.c_str()));
    out.push_back(nullptr);
    return out;
}

// Only what may be called between fork and exec.
[[noreturn]] void becomeChild(char** arguments, char** environment, const char* directory, int in, int out, int err,
                              const std::pair<int, int>* further, size_t furtherCount, int report) {
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    bool good = ::dup2(in, 0) >= 0 && ::dup2(out, 1) >= 0 && ::dup2(err, 2) >= 0;
    for (size_t i = 0; good && i < furtherCount; ++i) {
        auto [from, to] = further[i];
        good = from == to ? ::fcntl(to, F_SETFD, 0) == 0 : ::dup2(from, to) >= 0;
    }
    if (good && *directory) good = ::chdir(directory) == 0;
    if (good) ::execvpe(arguments[0], arguments, environment);
    int error = errno;
    [[maybe_unused]] ssize_t n = ::write(report, &error, sizeof error);
    ::_exit(127);
}

// Writing to a child that has ended is no reason for this process to end.
class WithoutBrokenPipeSignal {
public:
    WithoutBrokenPipeSignal() {
        sigemptyset(&_pipe);
        sigaddset(&_pipe, SIGPIPE);
        pthread_sigmask(SIG_BLOCK, &_pipe, &_former);
    }
    ~WithoutBrokenPipeSignal() {
        timespec now{};
        while (::sigtimedwait(&_pipe, nullptr, &now) < 0 && errno == EINTR) {
        }
        pthread_sigmask(SIG_SETMASK, &_former, nullptr);
    }

private:
    sigset_t _pipe, _former;
};

int milliseconds(double seconds) {
    return static_cast<int>(seconds * 1000) + 1;
}

} // namespace

ChildProcess::ChildProcess(Options options) {
    traceTermination();
    start(options);
    if (!options.input.empty()) {
        writeInput(options.input);
        closeInput();
    }
}

void ChildProcess::start(const Options& options) {
    auto arguments = pointers(options.arguments);
    std::vector<char*> environment;
    if (options.environment) environment = pointers(*options.environment);
    Pipe in, out, err, report;
    _pid = ::fork();
    if (_pid == 0)
        becomeChild(arguments.data(), options.environment ? environment.data() : ::environ, options.directory.c_str(),
                    in.read, out.write, err.write, options.descriptors.data(), options.descriptors.size(),
                    report.write);
    for (int fd : {in.read, out.write, err.write, report.write}) ::close(fd);
    _input = in.write;
    _out.fd = out.read;
    _err.fd = err.read;
    int error = 0;
    bool failed = _pid < 0 || ::read(report.read, &error, sizeof error) == sizeof error;
    ::close(report.read);
    if (failed) {
        if (_pid > 0) ::waitpid(_pid, nullptr, 0);
        for (int fd : {_input, _out.fd, _err.fd}) ::close(fd);
        throw std::runtime_error("cannot start " + options.arguments.at(0) + ": " +
                                 std::strerror(error ? error : errno));
    }
    _pidDescriptor = static_cast<int>(::syscall(SYS_pidfd_open, _pid, 0));
    _control = ::eventfd(0, EFD_CLOEXEC);
    for (int fd : {_out.fd, _err.fd}) ::fcntl(fd, F_SETFL, O_NONBLOCK);
    _reader = std::thread([this] { readOutput(); });
}

ChildProcess::~ChildProcess() {
    kill();
    finishOutput();
    closeInput();
    for (int fd : {_out.fd, _err.fd, _pidDescriptor, _control}) ::close(fd);
}

// Takes what is there; false at the end of the stream.
bool ChildProcess::readSome(Stream& stream) {
    std::array<char, 16384> buffer;
    while (true) {
        ssize_t n = ::read(stream.fd, buffer.data(), buffer.size());
        if (n < 0) return errno == EAGAIN || errno == EINTR;
        std::lock_guard guard(_mutex);
        if (n == 0 && stream.lineStart < stream.text.size()) _lines.push_back(stream.text.substr(stream.lineStart));
        if (n == 0) return false;
        stream.text.append(buffer.data(), static_cast<size_t>(n));
        for (size_t end; (end = stream.text.find('\n', stream.lineStart)) != std::string::npos;
             stream.lineStart = end + 1)
            _lines.push_back(stream.text.substr(stream.lineStart, end - stream.lineStart));
        _changed.notify_all();
    }
}

void ChildProcess::readOutput() {
    bool stop = false;
    while (!stop && !(_out.ended && _err.ended)) {
        std::array<pollfd, 3> polled{
            {{_out.ended ? -1 : _out.fd, POLLIN, 0}, {_err.ended ? -1 : _err.fd, POLLIN, 0}, {_control, POLLIN, 0}}};
        if (::poll(polled.data(), polled.size(), -1) < 0) continue;
        stop = polled[2].revents != 0;
        if (!_out.ended) _out.ended = !readSome(_out);
        if (!_err.ended) _err.ended = !readSome(_err);
    }
    std::lock_guard guard(_mutex);
    _readerDone = true;
    _changed.notify_all();
}

void ChildProcess::finishOutput() {
    if (!_reader.joinable()) return;
    ::eventfd_write(_control, 1);
    _reader.join();
}

bool ChildProcess::running() {
    return !wait(0);
}

void ChildProcess::signal(int number) {
    if (!_ending) ::kill(_pid, number);
}

void ChildProcess::closeInput() {
    if (_input >= 0) ::close(_input);
    _input = -1;
}

void ChildProcess::writeInput(const std::string& text) {
    WithoutBrokenPipeSignal guard;
    for (size_t done = 0; done < text.size();) {
        ssize_t n = ::write(_input, text.data() + done, text.size() - done);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) return; // it does not read; what it says instead is what matters
        done += static_cast<size_t>(n);
    }
}

std::optional<ChildProcess::Ending> ChildProcess::wait(double timeoutSeconds) {
    if (_ending) return _ending;
    auto deadline = std::chrono::steady_clock::now() + std::chrono::duration<double>(timeoutSeconds);
    pollfd polled{_pidDescriptor, POLLIN, 0};
    while (::poll(&polled, 1, timeoutSeconds <= 0 ? 0 : milliseconds(timeoutSeconds)) < 0)
        timeoutSeconds = std::chrono::duration<double>(deadline - std::chrono::steady_clock::now()).count();
    int status = 0;
    if (!polled.revents || ::waitpid(_pid, &status, WNOHANG) != _pid) return {};
    _ending = Ending{WIFEXITED(status) ? WEXITSTATUS(status) : 0, WIFSIGNALED(status) ? WTERMSIG(status) : 0};
    finishOutput();
    return _ending;
}

ChildProcess::Ending ChildProcess::kill() {
    signal(SIGKILL);
    while (!wait(30)) signal(SIGKILL);
    return *_ending;
}

std::string ChildProcess::output() const {
    std::lock_guard guard(_mutex);
    return _out.text;
}

std::string ChildProcess::errors() const {
    std::lock_guard guard(_mutex);
    return _err.text;
}

std::optional<std::string> ChildProcess::waitForLine(const std::string& pattern, double timeoutSeconds) {
    std::regex expression(pattern);
    auto deadline = std::chrono::steady_clock::now() + std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                                                           std::chrono::duration<double>(timeoutSeconds));
    std::unique_lock guard(_mutex);
    size_t looked = _nextLine;
    while (true) {
        for (; looked < _lines.size(); ++looked)
            if (std::regex_search(_lines[looked], expression)) {
                _nextLine = looked + 1;
                return _lines[looked];
            }
        if (_readerDone) return {};
        if (_changed.wait_until(guard, deadline) == std::cv_status::timeout && looked == _lines.size()) return {};
    }
}

} // namespace rolvane::test
