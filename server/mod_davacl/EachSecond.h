#pragma once

#include <condition_variable>
#include <functional>
#include <mutex>
#include <thread>

namespace rolvane::davacl {

// Calls a function once a second, on a thread of its own that no signal comes to, until it is destroyed.
class EachSecond {
public:
    explicit EachSecond(std::function<void()> what);
    ~EachSecond(); // waits for a call under way
    EachSecond(const EachSecond&) = delete;
    EachSecond& operator=(const EachSecond&) = delete;

private:
    void serve();
    const std::function<void()> _what;
    std::mutex _mutex;
    std::condition_variable _end;
    bool _ended = false; // guarded by _mutex
    std::thread _thread;
};

} // namespace rolvane::davacl
