#include "server/mod_davacl/EachSecond.h"

#include <chrono>
#include <csignal>
#include <utility>

namespace rolvane::davacl {

EachSecond::EachSecond(std::function<void()> what) : _what(std::move(what)) {
    sigset_t all, before;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &before); // signals are the other threads'
    _thread = std::thread([this] { serve(); });
    pthread_sigmask(SIG_SETMASK, &before, nullptr);
}

EachSecond::~EachSecond() {
    {
        const std::lock_guard lock(_mutex);
        _ended = true;
    }
    _end.notify_all();
    _thread.join();
}

void EachSecond::serve() {
    std::unique_lock lock(_mutex);
    while (!_end.wait_for(lock, std::chrono::seconds(1), [this] { return _ended; })) {
        lock.unlock();
        _what();
        lock.lock();
    }
}

} // namespace rolvane::davacl
