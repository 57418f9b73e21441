#pragma once

#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace rolvane::test {

// Numbers what happens on several threads in the order in which it happens: what ended before something else began has
// the smaller number. Any thread.
class Order {
public:
    uint64_t next() { return ++_last; }

private:
    std::atomic<uint64_t> _last{0};
};

// A client that writes into a collection of a store, on several threads and as fast as it can, with every method that
// changes something: plain HTTPS, a kept connection a thread, no other part of this system. From its construction
// until its end.
class LoadWriters {
public:
    struct Options {
        std::string collection; // its URL, with a slash at the end
        std::string caFile, user, password;
        int threads = 3;
    };
    struct Request {
        uint64_t began, ended; // in the order
        int status;            // 0: no answer
        const char* method;
    };
    LoadWriters(Options options, Order& order);
    ~LoadWriters();
    LoadWriters(const LoadWriters&) = delete;
    LoadWriters& operator=(const LoadWriters&) = delete;

    // Until every thread has finished so many requests that began after the moment; false after half a minute.
    bool awaitEach(size_t count, uint64_t after);
    std::vector<Request> requests() const; // that have ended, in no certain order

private:
    void write(int thread);
    void finished(int thread, Request request);

    const Options _options;
    Order& _order;
    std::atomic<bool> _ending{false};
    mutable std::mutex _mutex; // guards the following
    std::condition_variable _changed;
    std::vector<std::vector<Request>> _requests; // by thread
    std::vector<std::thread> _threads;           // the last member: they use the others
};

} // namespace rolvane::test
