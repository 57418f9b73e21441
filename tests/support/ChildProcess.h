#pragma once

#include <condition_variable>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include <sys/types.h>

namespace rolvane::test {

// A child process whose output is read while it runs. Killed (SIGKILL) and reaped when this object ends, and by the
// kernel when the thread that made it ends. Used by one thread.
class ChildProcess {
public:
    struct Options {
        std::vector<std::string> arguments = {};                  // the program first; searched in PATH without a slash
        std::optional<std::vector<std::string>> environment = {}; // "NAME=value"; none: the parent's
        std::string directory = {};                               // empty: the parent's
        std::string input = {};                                   // what it reads from standard input, then end of file
        std::vector<std::pair<int, int>> descriptors = {};        // {parent's, child's}: further ones that it inherits
    };
    struct Ending {
        int status = 0; // exit status, when it exited
        int signal = 0; // signal that ended it, else 0
        bool exitedWith(int expected) const { return signal == 0 && status == expected; }
    };

    explicit ChildProcess(Options options); // throws std::runtime_error when it cannot be started
    explicit ChildProcess(std::vector<std::string> arguments)
        : ChildProcess(Options{.arguments = std::move(arguments)}) {}
    ~ChildProcess();
    ChildProcess(const ChildProcess&) = delete;
    ChildProcess& operator=(const ChildProcess&) = delete;

    pid_t pid() const { return _pid; }
    bool running(); // false once it has ended
    void signal(int number);
    void closeInput();
    void writeInput(const std::string& text); // only with `Options::input` empty

    // None when the time ran out. After an ending all output that was written is in `output` and `errors`.
    std::optional<Ending> wait(double timeoutSeconds = 30);
    Ending kill(); // SIGKILL and wait

    std::string output() const; // standard output so far
    std::string errors() const; // standard error so far
    // The first whole line of either stream that matches the ECMAScript pattern somewhere, after the line that the last
    // successful call gave. None when the time ran out or the child's output ended without it.
    std::optional<std::string> waitForLine(const std::string& pattern, double timeoutSeconds = 30);

private:
    struct Stream {
        int fd = -1;
        std::string text;
        size_t lineStart = 0;
        bool ended = false;
    };
    void start(const Options& options);
    void readOutput();
    bool readSome(Stream& stream);
    void finishOutput();

    pid_t _pid = -1;
    int _pidDescriptor = -1;
    int _input = -1;
    int _control = -1; // eventfd: tells the reader to take what is there and stop
    std::optional<Ending> _ending;
    mutable std::mutex _mutex; // of the streams' texts and the lines
    std::condition_variable _changed;
    Stream _out, _err;
    std::vector<std::string> _lines; // whole lines of both streams in order of arrival
    size_t _nextLine = 0;
    bool _readerDone = false;
    std::thread _reader;
};

} // namespace rolvane::test
